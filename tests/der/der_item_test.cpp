#include <gtest/gtest.h>

#include <cstdint>
#include <limits>

#include "der/der_item.h"
#include "der_test_util.h"

namespace {

using dertest::Bytes;
using dertest::cat;
using dertest::repeat;
using dertest::slice;

// A record that a failing call must leave as it was.
DERDecodedItem sentinelItem() {
  static const std::uint8_t marker = 0xEE;
  return DERDecodedItem{0x1234, DERSlice{&marker, 77}};
}

void expectUntouched(const DERDecodedItem& item) {
  const DERDecodedItem sentinel = sentinelItem();
  EXPECT_EQ(item.tag, sentinel.tag);
  EXPECT_EQ(item.content.data, sentinel.content.data);
  EXPECT_EQ(item.content.length, sentinel.content.length);
}

DERStatus decode(const Bytes& bytes, DERDecodedItem& item) {
  return DERDecodeItem(slice(bytes), &item);
}

DERStatus decodeStatus(const Bytes& bytes) {
  DERDecodedItem item;
  return decode(bytes, item);
}

TEST(DERDecodeItem, EmptySequence) {
  const Bytes in{0x30, 0x00};
  DERDecodedItem item;
  ASSERT_EQ(decode(in, item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, 0x2000000000000010ULL);
  EXPECT_EQ(item.content.data, in.data() + 2);
  EXPECT_EQ(item.content.length, 0u);
}

TEST(DERDecodeItem, InputShorterThanTwoBytes) {
  DERDecodedItem item = sentinelItem();
  EXPECT_EQ(decode(Bytes{0x30}, item), DER_STATUS_DECODE_ERROR);
  expectUntouched(item);
  EXPECT_EQ(DERDecodeItem(DERSlice{nullptr, 0}, &item), DER_STATUS_DECODE_ERROR);
  expectUntouched(item);
}

TEST(DERDecodeItem, ShortFormPrimitive) {
  const Bytes in{0x02, 0x03, 0x01, 0x00, 0x01};
  DERDecodedItem item;
  ASSERT_EQ(decode(in, item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_INTEGER);
  EXPECT_EQ(item.content.data, in.data() + 2);
  EXPECT_EQ(item.content.length, 3u);
}

TEST(DERDecodeItem, BytesAfterTheItemAreIgnored) {
  const Bytes in{0x02, 0x01, 0x05, 0xFF, 0xFF, 0xFF};
  DERDecodedItem item;
  ASSERT_EQ(decode(in, item), DER_STATUS_OK);
  EXPECT_EQ(item.content.data, in.data() + 2);
  EXPECT_EQ(item.content.length, 1u);
}

TEST(DERDecodeItem, ClassAndConstructedBitsMoveToTheTopOfTheTag) {
  struct Case {
    std::uint8_t identifier;
    DERTag tag;
  };
  const Case cases[] = {
      {0x04, 0x0000000000000004ULL},  // universal primitive
      {0x24, 0x2000000000000004ULL},  // universal constructed
      {0x41, 0x4000000000000001ULL},  // application primitive
      {0x80, 0x8000000000000000ULL},  // context-specific primitive [0]
      {0xA3, 0xA000000000000003ULL},  // context-specific constructed [3]
      {0xDE, 0xC00000000000001EULL},  // private primitive 30
      {0xFE, 0xE00000000000001EULL},  // private constructed 30
  };
  for (const Case& c : cases) {
    DERDecodedItem item;
    ASSERT_EQ(decode(Bytes{c.identifier, 0x00}, item), DER_STATUS_OK) << int{c.identifier};
    EXPECT_EQ(item.tag, c.tag) << int{c.identifier};
    EXPECT_EQ(item.tag & DER_TAG_CLASS_MASK, (DERTag{c.identifier} & 0xC0) << 56);
  }
}

TEST(DERDecodeItem, HighTagNumberForm) {
  struct Case {
    Bytes in;
    DERTag tag;
  };
  const Case cases[] = {
      {{0x1F, 0x1F, 0x00}, 31},
      {{0x1F, 0x7F, 0x00}, 127},
      {{0x1F, 0x81, 0x00, 0x00}, 128},
      {{0x1F, 0x81, 0x80, 0x01, 0x00}, (1u << 14) | 1u},
      {{0xBF, 0x81, 0x00, 0x00}, DER_TAG_CLASS_CONTEXT_SPECIFIC | DER_TAG_CONSTRUCTED | 128},
      {{0xDF, 0x2A, 0x00}, DER_TAG_CLASS_PRIVATE | 42},
  };
  for (const Case& c : cases) {
    DERDecodedItem item;
    ASSERT_EQ(decode(c.in, item), DER_STATUS_OK);
    EXPECT_EQ(item.tag, c.tag);
    EXPECT_EQ(item.content.data, c.in.data() + c.in.size());
    EXPECT_EQ(item.content.length, 0u);
  }
}

TEST(DERDecodeItem, HighTagNumberWithContent) {
  const Bytes in{0x9F, 0x81, 0x00, 0x02, 0xAA, 0xBB};
  DERDecodedItem item;
  ASSERT_EQ(decode(in, item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_CLASS_CONTEXT_SPECIFIC | 128);
  EXPECT_EQ(item.content.data, in.data() + 4);
  EXPECT_EQ(item.content.length, 2u);
}

TEST(DERDecodeItem, HighTagNumberThatFitsTheShortFormIsRefused) {
  EXPECT_EQ(decodeStatus({0x1F, 0x1E, 0x00}), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(decodeStatus({0x1F, 0x00, 0x00}), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(decodeStatus({0x1F, 0x10, 0x00}), DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeItem, HighTagNumberWithLeadingZeroGroupIsRefused) {
  EXPECT_EQ(decodeStatus({0x1F, 0x80, 0x01, 0x00}), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(decodeStatus({0x1F, 0x80, 0x81, 0x01, 0x00}), DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeItem, HighTagNumberMustLeaveRoomForTheLengthOctet) {
  // Each input is cut short inside a buffer whose next bytes would complete a valid item, so a
  // read past the end of the input would show as a success.
  const Bytes buffer{0x1F, 0x81, 0x81, 0x01, 0x00};
  DERDecodedItem item;
  ASSERT_EQ(DERDecodeItem(DERSlice{buffer.data(), 5}, &item), DER_STATUS_OK);
  for (std::uint64_t length = 0; length < 5; ++length) {
    EXPECT_EQ(DERDecodeItem(DERSlice{buffer.data(), length}, &item), DER_STATUS_DECODE_ERROR)
        << length;
  }
  const Bytes shortNumber{0x1F, 0x1F, 0x00};
  EXPECT_EQ(DERDecodeItem(DERSlice{shortNumber.data(), 2}, &item), DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeItem, LargestTagNumber) {
  // 2^61 - 1 in nine groups: 5 bits, then 8 x 7 bits.
  const Bytes in{0x1F, 0x9F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0x7F, 0x00};
  DERDecodedItem item;
  ASSERT_EQ(decode(in, item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_NUMBER_MASK);
}

TEST(DERDecodeItem, TagNumberReachingTheClassBitsIsRefused) {
  // 2^61: it would read as the constructed flag.
  EXPECT_EQ(decodeStatus({0x1F, 0xA0, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x00, 0x00}),
            DER_STATUS_DECODE_ERROR);
  // 2^63 - 1: bits 62 and 61 as well.
  EXPECT_EQ(decodeStatus({0x1F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0x7F, 0x00}),
            DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeItem, TagNumberWiderThan64BitsIsRefused) {
  // Ten groups: the number would be shifted out of 64 bits.
  EXPECT_EQ(decodeStatus({0x1F, 0x84, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x00, 0x00}),
            DER_STATUS_DECODE_ERROR);
  // An endless run of continuation groups ends in a refusal, not in a read past the buffer.
  EXPECT_EQ(decodeStatus(cat({{0x1F}, repeat(0xFF, 4096), {0x00}})), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(decodeStatus(cat({{0x1F}, repeat(0x81, 4096)})), DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeItem, LongFormLength) {
  const Bytes in = cat({{0x30, 0x82, 0x01, 0x2C}, repeat(0x05, 300)});
  DERDecodedItem item;
  ASSERT_EQ(decode(in, item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_SEQUENCE);
  EXPECT_EQ(item.content.data, in.data() + 4);
  EXPECT_EQ(item.content.length, 300u);
}

TEST(DERDecodeItem, LongFormBelow128IsAccepted) {
  const Bytes in = cat({{0x04, 0x81, 0x05}, repeat(0xAB, 5)});
  DERDecodedItem item;
  ASSERT_EQ(decode(in, item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_OCTET_STRING);
  EXPECT_EQ(item.content.data, in.data() + 3);
  EXPECT_EQ(item.content.length, 5u);

  const Bytes wide{0x04, 0x84, 0x01, 0x00, 0x00, 0x00};
  EXPECT_EQ(decodeStatus(wide), DER_STATUS_DECODE_ERROR);  // 2^24 bytes claimed, none there
  const Bytes zeroInLongForm{0x04, 0x81, 0x01, 0x00};
  EXPECT_EQ(decodeStatus(zeroInLongForm), DER_STATUS_OK);
}

TEST(DERDecodeItem, LongFormWithLeadingZeroByteIsRefused) {
  EXPECT_EQ(decodeStatus({0x04, 0x81, 0x00}), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(decodeStatus(cat({{0x04, 0x82, 0x00, 0x80}, repeat(0, 128)})),
            DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeItem, IndefiniteLengthIsRefused) {
  EXPECT_EQ(decodeStatus({0x04, 0x80}), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(decodeStatus({0x30, 0x80, 0x00, 0x00}), DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeItem, MoreThanEightLengthBytesIsRefused) {
  EXPECT_EQ(decodeStatus(cat({{0x04, 0x89}, repeat(0x01, 9)})), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(decodeStatus(cat({{0x04, 0xFF}, repeat(0x01, 200)})), DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeItem, TruncatedLengthBytesAreRefused) {
  // As above: the bytes after each cut would complete the length octets.
  const Bytes buffer{0x04, 0x82, 0x01, 0x00, 0x00};
  DERDecodedItem item;
  for (std::uint64_t length = 2; length < 4; ++length) {
    EXPECT_EQ(DERDecodeItem(DERSlice{buffer.data(), length}, &item), DER_STATUS_DECODE_ERROR)
        << length;
  }
  const Bytes eight{0x04, 0x88, 0x01, 0x02, 0x03, 0x04, 0x05, 0x06, 0x07, 0x08};
  for (std::uint64_t length = 2; length < eight.size(); ++length) {
    EXPECT_EQ(DERDecodeItemPartialBuffer(DERSlice{eight.data(), length}, &item, true),
              DER_STATUS_DECODE_ERROR)
        << length;
  }
  ASSERT_EQ(DERDecodeItemPartialBuffer(slice(eight), &item, true), DER_STATUS_OK);
  EXPECT_EQ(item.content.length, 0x0102030405060708u);
}

TEST(DERDecodeItem, ContentLongerThanTheInputIsRefused) {
  DERDecodedItem item = sentinelItem();
  EXPECT_EQ(decode(Bytes{0x04, 0x05, 0x01, 0x02}, item), DER_STATUS_DECODE_ERROR);
  expectUntouched(item);
  EXPECT_EQ(decodeStatus({0x04, 0x01}), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(decodeStatus({0x04, 0x88, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0x00}),
            DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeItem, ContentIsBoundedByTheSliceNotByTheBuffer) {
  const Bytes buffer{0x04, 0x03, 0x01, 0x02, 0x03};
  DERDecodedItem item;
  EXPECT_EQ(DERDecodeItem(DERSlice{buffer.data(), 4}, &item), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeItem(DERSlice{buffer.data(), 5}, &item), DER_STATUS_OK);
}

TEST(DERDecodeItemPartialBufferGetLength, WithoutOutLengthIsStrict) {
  const Bytes in{0x04, 0x05, 0x01, 0x02};
  DERDecodedItem item = sentinelItem();
  EXPECT_EQ(DERDecodeItemPartialBufferGetLength(slice(in), &item, nullptr),
            DER_STATUS_DECODE_ERROR);
  expectUntouched(item);
}

TEST(DERDecodeItemPartialBufferGetLength, ClipsAnOverrunningContent) {
  const Bytes in{0x04, 0x05, 0x01, 0x02};
  DERDecodedItem item;
  std::uint64_t declared = 0;
  ASSERT_EQ(DERDecodeItemPartialBufferGetLength(slice(in), &item, &declared), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_OCTET_STRING);
  EXPECT_EQ(item.content.data, in.data() + 2);
  EXPECT_EQ(item.content.length, 2u);
  EXPECT_EQ(declared, 5u);
}

TEST(DERDecodeItemPartialBufferGetLength, HeaderOnlyAndHugeDeclaredLength) {
  const Bytes in{0x04, 0x88, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF};
  DERDecodedItem item;
  std::uint64_t declared = 0;
  ASSERT_EQ(DERDecodeItemPartialBufferGetLength(slice(in), &item, &declared), DER_STATUS_OK);
  EXPECT_EQ(item.content.data, in.data() + in.size());
  EXPECT_EQ(item.content.length, 0u);
  EXPECT_EQ(declared, std::numeric_limits<std::uint64_t>::max());
}

TEST(DERDecodeItemPartialBufferGetLength, CompleteItemReportsItsLength) {
  const Bytes in{0x02, 0x02, 0x01, 0x00, 0xFF};
  DERDecodedItem item;
  std::uint64_t declared = 0;
  ASSERT_EQ(DERDecodeItemPartialBufferGetLength(slice(in), &item, &declared), DER_STATUS_OK);
  EXPECT_EQ(item.content.data, in.data() + 2);
  EXPECT_EQ(item.content.length, 2u);
  EXPECT_EQ(declared, 2u);
}

TEST(DERDecodeItemPartialBufferGetLength, MalformedHeaderStillFails) {
  std::uint64_t declared = 99;
  DERDecodedItem item = sentinelItem();
  EXPECT_EQ(DERDecodeItemPartialBufferGetLength(slice({0x04, 0x80}), &item, &declared),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeItemPartialBufferGetLength(slice({0x04, 0x81, 0x00}), &item, &declared),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeItemPartialBufferGetLength(slice({0x04, 0x82, 0x01}), &item, &declared),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeItemPartialBufferGetLength(slice({0x1F, 0x1E, 0x00}), &item, &declared),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeItemPartialBufferGetLength(slice({0x04}), &item, &declared),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(declared, 99u);
  expectUntouched(item);
}

TEST(DERDecodeItemPartialBuffer, FlagClearIsStrict) {
  DERDecodedItem item = sentinelItem();
  EXPECT_EQ(DERDecodeItemPartialBuffer(slice({0x04, 0x05, 0x01, 0x02}), &item, false),
            DER_STATUS_DECODE_ERROR);
  expectUntouched(item);
  const Bytes ok{0x04, 0x02, 0x01, 0x02};
  ASSERT_EQ(DERDecodeItemPartialBuffer(slice(ok), &item, false), DER_STATUS_OK);
  EXPECT_EQ(item.content.length, 2u);
}

TEST(DERDecodeItemPartialBuffer, FlagSetReportsTheDeclaredLengthUnclipped) {
  const Bytes in{0x04, 0x05, 0x01, 0x02};
  DERDecodedItem item;
  ASSERT_EQ(DERDecodeItemPartialBuffer(slice(in), &item, true), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_OCTET_STRING);
  EXPECT_EQ(item.content.data, in.data() + 2);
  EXPECT_EQ(item.content.length, 5u);

  const Bytes huge{0x04, 0x88, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF};
  ASSERT_EQ(DERDecodeItemPartialBuffer(slice(huge), &item, true), DER_STATUS_OK);
  EXPECT_EQ(item.content.length, std::numeric_limits<std::uint64_t>::max());
}

TEST(DERDecodeItemPartialBuffer, FlagSetStillRefusesMalformedHeaders) {
  DERDecodedItem item = sentinelItem();
  EXPECT_EQ(DERDecodeItemPartialBuffer(slice({0x04, 0x80}), &item, true), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeItemPartialBuffer(slice({0x04, 0x89}), &item, true), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeItemPartialBuffer(slice({0x1F, 0x80, 0x01, 0x00}), &item, true),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeItemPartialBuffer(slice({0x04}), &item, true), DER_STATUS_DECODE_ERROR);
  expectUntouched(item);
}

// Cuts a blob of items written back to back, the way token data is cut: each item's encoding
// runs from its first byte to the end of its content.
TEST(DERDecodeItem, ItemsBackToBackCanBeWalked) {
  const Bytes first = cat({{0x30, 0x82, 0x01, 0x2C}, repeat(0x05, 300)});
  const Bytes second{0x02, 0x01, 0x07};
  const Bytes third{0xA0, 0x81, 0x02, 0x05, 0x00};
  const Bytes blob = cat({first, second, third});

  std::vector<Bytes> items;
  const std::uint8_t* p = blob.data();
  const std::uint8_t* end = blob.data() + blob.size();
  while (p < end) {
    DERDecodedItem item;
    ASSERT_EQ(DERDecodeItem(DERSlice{p, static_cast<std::uint64_t>(end - p)}, &item),
              DER_STATUS_OK);
    const std::uint8_t* itemEnd = item.content.data + item.content.length;
    items.emplace_back(p, itemEnd);
    p = itemEnd;
  }
  ASSERT_EQ(items.size(), 3u);
  EXPECT_EQ(items[0], first);
  EXPECT_EQ(items[1], second);
  EXPECT_EQ(items[2], third);
}

}  // namespace
