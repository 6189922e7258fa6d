#include <gtest/gtest.h>

#include <cstddef>
#include <cstdint>
#include <cstring>

#include "der/der_sequence.h"
#include "der_test_util.h"

namespace {

using dertest::Bytes;
using dertest::cat;
using dertest::repeat;
using dertest::slice;

const Bytes kInteger{0x02, 0x01, 0x2A};
const Bytes kTrue{0x01, 0x01, 0xFF};
const Bytes kOctets{0x04, 0x02, 0xAB, 0xCD};

Bytes sequenceOf(const Bytes& content) {
  return cat({{0x30, static_cast<std::uint8_t>(content.size())}, content});
}

bool isNull(const DERSlice& s) { return s.data == nullptr && s.length == 0; }

// ---- Sequence walking ----------------------------------------------------------------------

TEST(DERDecodeSeqInit, WalksTheItemsOfASequence) {
  const Bytes in = sequenceOf(cat({kInteger, kTrue}));
  DERTag tag = 0;
  DERSeqCursor cursor;
  ASSERT_EQ(DERDecodeSeqInit(slice(in), &tag, &cursor), DER_STATUS_OK);
  EXPECT_EQ(tag, DER_TAG_SEQUENCE);
  EXPECT_EQ(cursor.next, in.data() + 2);
  EXPECT_EQ(cursor.end, in.data() + in.size());

  DERDecodedItem item;
  ASSERT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_INTEGER);
  EXPECT_EQ(item.content.data, in.data() + 4);
  EXPECT_EQ(item.content.length, 1u);
  ASSERT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_BOOLEAN);
  EXPECT_EQ(item.content.data, in.data() + 7);
  EXPECT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_END_OF_SEQUENCE);
  EXPECT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_END_OF_SEQUENCE);
}

TEST(DERDecodeSeqInit, AcceptsASet) {
  const Bytes in{0x31, 0x00};
  DERTag tag = 0;
  DERSeqCursor cursor;
  ASSERT_EQ(DERDecodeSeqInit(slice(in), &tag, &cursor), DER_STATUS_OK);
  EXPECT_EQ(tag, DER_TAG_SET);
  DERDecodedItem item;
  EXPECT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_END_OF_SEQUENCE);
}

TEST(DERDecodeSeqInit, RefusesOtherTagsButReportsThem) {
  struct Case {
    Bytes in;
    DERTag tag;
  };
  const Case cases[] = {
      {{0x04, 0x00}, DER_TAG_OCTET_STRING},
      {{0x10, 0x00}, 0x10},                                       // primitive SEQUENCE
      {{0x11, 0x00}, 0x11},                                       // primitive SET
      {{0x32, 0x00}, DER_TAG_CONSTRUCTED | 0x12},                 // differs in more than bit 0
      {{0xA0, 0x00}, DER_TAG_CLASS_CONTEXT_SPECIFIC | DER_TAG_CONSTRUCTED},
      {{0x70, 0x00}, DER_TAG_CLASS_APPLICATION | DER_TAG_CONSTRUCTED | 0x10},
  };
  for (const Case& c : cases) {
    DERTag tag = 0;
    DERSeqCursor cursor{nullptr, nullptr};
    EXPECT_EQ(DERDecodeSeqInit(slice(c.in), &tag, &cursor), DER_STATUS_UNEXPECTED_TAG);
    EXPECT_EQ(tag, c.tag);
    EXPECT_EQ(cursor.next, nullptr);
  }
}

TEST(DERDecodeSeqInit, DecodeFailureLeavesTheTag) {
  DERTag tag = 0x77;
  DERSeqCursor cursor;
  EXPECT_EQ(DERDecodeSeqInit(slice({0x30}), &tag, &cursor), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeSeqInit(slice({0x30, 0x03, 0x02, 0x01}), &tag, &cursor),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERDecodeSeqInit(slice({0x30, 0x80, 0x00, 0x00}), &tag, &cursor),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(tag, 0x77u);
}

TEST(DERDecodeSeqContentInit, SetsTheCursorOnTheRange) {
  const Bytes content = cat({kInteger, kOctets});
  DERSeqCursor cursor;
  EXPECT_EQ(DERDecodeSeqContentInit(slice(content), &cursor), DER_STATUS_OK);
  EXPECT_EQ(cursor.next, content.data());
  EXPECT_EQ(cursor.end, content.data() + content.size());
  DERDecodedItem item;
  ASSERT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_OK);
  ASSERT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_OCTET_STRING);
  EXPECT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_END_OF_SEQUENCE);

  EXPECT_EQ(DERDecodeSeqContentInit(DERSlice{}, &cursor), DER_STATUS_OK);
  EXPECT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_END_OF_SEQUENCE);
}

TEST(DERDecodeSeqNext, TrailingFragmentFailsAndKeepsTheCursor) {
  const Bytes content = cat({kInteger, {0x05}});
  DERSeqCursor cursor;
  DERDecodeSeqContentInit(slice(content), &cursor);
  DERDecodedItem item;
  ASSERT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_OK);
  const DERSeqCursor before = cursor;
  EXPECT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(cursor.next, before.next);
  EXPECT_EQ(cursor.end, before.end);
  EXPECT_EQ(item.tag, DER_TAG_INTEGER);  // the item of the last success is kept
}

TEST(DERDecodeSeqNext, ItemMayNotRunPastTheSequenceEvenInsideTheBuffer) {
  // The sequence claims 3 bytes, but its INTEGER claims 5, which the buffer happens to hold.
  const Bytes in{0x30, 0x03, 0x02, 0x05, 0x01, 0x02, 0x03, 0x04, 0x05};
  DERTag tag = 0;
  DERSeqCursor cursor;
  ASSERT_EQ(DERDecodeSeqInit(slice(in), &tag, &cursor), DER_STATUS_OK);
  DERDecodedItem item;
  EXPECT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_DECODE_ERROR);
}

TEST(DERDecodeSeqNext, ConstructedItemsAreNotDescendedInto) {
  const Bytes inner = sequenceOf(cat({kInteger, kInteger}));
  const Bytes in = sequenceOf(cat({inner, kTrue}));
  DERTag tag = 0;
  DERSeqCursor cursor;
  ASSERT_EQ(DERDecodeSeqInit(slice(in), &tag, &cursor), DER_STATUS_OK);
  DERDecodedItem item;
  ASSERT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_SEQUENCE);
  EXPECT_EQ(item.content.length, 6u);
  ASSERT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_OK);
  EXPECT_EQ(item.tag, DER_TAG_BOOLEAN);
  EXPECT_EQ(DERDecodeSeqNext(&cursor, &item), DER_STATUS_END_OF_SEQUENCE);
}

// ---- Template parsing ----------------------------------------------------------------------

struct Record {
  DERSlice first;
  DERSlice second;
  DERSlice third;
  std::uint32_t extra;
};

constexpr std::uint64_t kFirst = offsetof(Record, first);
constexpr std::uint64_t kSecond = offsetof(Record, second);
constexpr std::uint64_t kThird = offsetof(Record, third);

// A required INTEGER then an optional BOOLEAN.
const DERFieldSpec kIntThenOptionalBool[] = {
    {kFirst, DER_TAG_INTEGER, 0},
    {kSecond, DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL},
};

Record filledRecord() {
  Record r;
  std::memset(static_cast<void*>(&r), 0x5A, sizeof r);
  return r;
}

TEST(DERParseSequence, AllFieldsPresent) {
  const Bytes in = sequenceOf(cat({kInteger, kTrue}));
  Record r = filledRecord();
  ASSERT_EQ(DERParseSequence(slice(in), 2, kIntThenOptionalBool, &r, sizeof r), DER_STATUS_OK);
  EXPECT_EQ(r.first.data, in.data() + 4);
  EXPECT_EQ(r.first.length, 1u);
  EXPECT_EQ(r.second.data, in.data() + 7);
  EXPECT_EQ(r.second.length, 1u);
  EXPECT_TRUE(isNull(r.third));  // zeroed, though no field names it
  EXPECT_EQ(r.extra, 0u);
}

TEST(DERParseSequence, AbsentOptionalFieldReadsAsNull) {
  const Bytes in = sequenceOf(kInteger);
  Record r = filledRecord();
  ASSERT_EQ(DERParseSequence(slice(in), 2, kIntThenOptionalBool, &r, sizeof r), DER_STATUS_OK);
  EXPECT_EQ(r.first.length, 1u);
  EXPECT_TRUE(isNull(r.second));
}

TEST(DERParseSequence, MissingRequiredFieldIsAnUnexpectedTag) {
  Record r;
  EXPECT_EQ(DERParseSequence(slice(sequenceOf(kTrue)), 2, kIntThenOptionalBool, &r, sizeof r),
            DER_STATUS_UNEXPECTED_TAG);
}

TEST(DERParseSequence, EmptySequenceIsIncomplete) {
  Record r;
  EXPECT_EQ(DERParseSequence(slice({0x30, 0x00}), 2, kIntThenOptionalBool, &r, sizeof r),
            DER_STATUS_INCOMPLETE_SEQUENCE);
}

TEST(DERParseSequence, OneItemMoreThanTheTemplateIsADecodeError) {
  Record r;
  const Bytes in = sequenceOf(cat({kInteger, kTrue, kInteger}));
  EXPECT_EQ(DERParseSequence(slice(in), 2, kIntThenOptionalBool, &r, sizeof r),
            DER_STATUS_DECODE_ERROR);
  // Even a fragment too short to be an item counts as bytes left over.
  const Bytes fragment = sequenceOf(cat({kInteger, kTrue, {0x00}}));
  EXPECT_EQ(DERParseSequence(slice(fragment), 2, kIntThenOptionalBool, &r, sizeof r),
            DER_STATUS_DECODE_ERROR);
}

TEST(DERParseSequence, ItemMatchingNoRemainingOptionalFieldIsAnUnexpectedTag) {
  Record r;
  const Bytes in = sequenceOf(cat({kInteger, kOctets}));
  EXPECT_EQ(DERParseSequence(slice(in), 2, kIntThenOptionalBool, &r, sizeof r),
            DER_STATUS_UNEXPECTED_TAG);
}

TEST(DERParseSequence, RequiresExactlyAConstructedSequence) {
  Record r = filledRecord();
  EXPECT_EQ(DERParseSequence(slice(cat({{0x31, 0x03}, kInteger})), 2, kIntThenOptionalBool, &r,
                             sizeof r),
            DER_STATUS_UNEXPECTED_TAG);
  EXPECT_EQ(DERParseSequence(slice(cat({{0x10, 0x03}, kInteger})), 2, kIntThenOptionalBool, &r,
                             sizeof r),
            DER_STATUS_UNEXPECTED_TAG);
  EXPECT_EQ(DERParseSequence(slice({0x30}), 2, kIntThenOptionalBool, &r, sizeof r),
            DER_STATUS_DECODE_ERROR);
  // The destination is cleared only once the sequence itself has been accepted.
  EXPECT_EQ(r.extra, 0x5A5A5A5Au);
}

TEST(DERParseSequence, BytesAfterTheSequenceAreIgnored) {
  const Bytes in = cat({sequenceOf(kInteger), {0xFF, 0xFF}});
  Record r;
  EXPECT_EQ(DERParseSequence(slice(in), 2, kIntThenOptionalBool, &r, sizeof r), DER_STATUS_OK);
}

TEST(DERParseSequence, ErrorInsideTheContentIsPassedOn) {
  Record r;
  const Bytes in = sequenceOf(cat({kInteger, {0x01, 0x80}}));
  EXPECT_EQ(DERParseSequence(slice(in), 2, kIntThenOptionalBool, &r, sizeof r),
            DER_STATUS_DECODE_ERROR);
}

TEST(DERParseSequenceContent, ZeroFields) {
  Record r = filledRecord();
  EXPECT_EQ(DERParseSequenceContent(DERSlice{}, 0, nullptr, &r, sizeof r), DER_STATUS_OK);
  EXPECT_EQ(r.extra, 0u);
  EXPECT_EQ(DERParseSequenceContent(slice(kInteger), 0, nullptr, &r, sizeof r),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseSequence(slice({0x30, 0x00}), 0, nullptr, nullptr, 0), DER_STATUS_OK);
  // The content need not even be well formed: it only has to be empty.
  EXPECT_EQ(DERParseSequenceContent(slice({0x05}), 0, nullptr, nullptr, 0),
            DER_STATUS_DECODE_ERROR);
}

TEST(DERParseSequenceContent, SkippedOptionalFieldIsNeverFilledLater) {
  // [optional INTEGER, required BOOLEAN, optional INTEGER] against (BOOLEAN, INTEGER).
  const DERFieldSpec fields[] = {
      {kFirst, DER_TAG_INTEGER, DER_FIELD_OPTIONAL},
      {kSecond, DER_TAG_BOOLEAN, 0},
      {kThird, DER_TAG_INTEGER, DER_FIELD_OPTIONAL},
  };
  const Bytes content = cat({kTrue, kInteger});
  Record r = filledRecord();
  ASSERT_EQ(DERParseSequenceContent(slice(content), 3, fields, &r, sizeof r), DER_STATUS_OK);
  EXPECT_TRUE(isNull(r.first));
  EXPECT_EQ(r.second.data, content.data() + 2);
  EXPECT_EQ(r.third.data, content.data() + 5);

  // [optional BOOLEAN, required INTEGER] against (INTEGER, BOOLEAN): the BOOLEAN comes too late.
  const DERFieldSpec late[] = {
      {kFirst, DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL},
      {kSecond, DER_TAG_INTEGER, 0},
  };
  EXPECT_EQ(DERParseSequenceContent(slice(cat({kInteger, kTrue})), 2, late, &r, sizeof r),
            DER_STATUS_DECODE_ERROR);
}

TEST(DERParseSequenceContent, SeveralOptionalFieldsPassedOverForOneItem) {
  const DERFieldSpec fields[] = {
      {kFirst, DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL},
      {kSecond, DER_TAG_OCTET_STRING, DER_FIELD_OPTIONAL},
      {kThird, DER_TAG_INTEGER, 0},
  };
  Record r = filledRecord();
  ASSERT_EQ(DERParseSequenceContent(slice(kInteger), 3, fields, &r, sizeof r), DER_STATUS_OK);
  EXPECT_TRUE(isNull(r.first));
  EXPECT_TRUE(isNull(r.second));
  EXPECT_EQ(r.third.length, 1u);
}

TEST(DERParseSequenceContent, RequiredFieldAfterTheLastItemIsIncomplete) {
  const DERFieldSpec fields[] = {
      {kFirst, DER_TAG_INTEGER, 0},
      {kSecond, DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL},
      {kThird, DER_TAG_OCTET_STRING, 0},
  };
  Record r;
  EXPECT_EQ(DERParseSequenceContent(slice(kInteger), 3, fields, &r, sizeof r),
            DER_STATUS_INCOMPLETE_SEQUENCE);
  EXPECT_EQ(DERParseSequenceContent(slice(cat({kInteger, kTrue})), 3, fields, &r, sizeof r),
            DER_STATUS_INCOMPLETE_SEQUENCE);
  EXPECT_EQ(DERParseSequenceContent(slice(cat({kInteger, kOctets})), 3, fields, &r, sizeof r),
            DER_STATUS_OK);
}

TEST(DERParseSequenceContent, TagsAreComparedWhole) {
  // A constructed OCTET STRING (0x24) is not an OCTET STRING (0x04), and [0] is not INTEGER.
  const DERFieldSpec octets[] = {{kFirst, DER_TAG_OCTET_STRING, 0}};
  Record r;
  EXPECT_EQ(DERParseSequenceContent(slice({0x24, 0x00}), 1, octets, &r, sizeof r),
            DER_STATUS_UNEXPECTED_TAG);
  const DERFieldSpec integer[] = {{kFirst, DER_TAG_INTEGER, 0}};
  EXPECT_EQ(DERParseSequenceContent(slice({0x82, 0x01, 0x00}), 1, integer, &r, sizeof r),
            DER_STATUS_UNEXPECTED_TAG);
  const DERFieldSpec context[] = {
      {kFirst, DER_TAG_CLASS_CONTEXT_SPECIFIC | DER_TAG_CONSTRUCTED | 0, 0}};
  const Bytes explicitZero = cat({{0xA0, 0x03}, kInteger});
  ASSERT_EQ(DERParseSequenceContent(slice(explicitZero), 1, context, &r, sizeof r),
            DER_STATUS_OK);
  EXPECT_EQ(r.first.data, explicitZero.data() + 2);
  EXPECT_EQ(r.first.length, 3u);
  const DERFieldSpec highTag[] = {{kFirst, DER_TAG_CLASS_CONTEXT_SPECIFIC | 200, 0}};
  EXPECT_EQ(DERParseSequenceContent(slice({0x9F, 0x81, 0x48, 0x00}), 1, highTag, &r, sizeof r),
            DER_STATUS_OK);
}

TEST(DERParseSequenceContent, SkipTagCheckMatchesAnyTag) {
  const DERFieldSpec fields[] = {
      {kFirst, DER_TAG_INTEGER, 0},
      {kSecond, 0, DER_FIELD_SKIP_TAG_CHECK},
  };
  for (const Bytes& any : {kTrue, kOctets, sequenceOf(kInteger), Bytes{0xDF, 0x7F, 0x00}}) {
    const Bytes content = cat({kInteger, any});
    Record r;
    ASSERT_EQ(DERParseSequenceContent(slice(content), 2, fields, &r, sizeof r), DER_STATUS_OK);
    EXPECT_EQ(r.second.data + r.second.length, content.data() + content.size());
  }
}

TEST(DERParseSequenceContent, OptionalSkipTagCheckTakesTheItemBeforeLaterFields) {
  const DERFieldSpec fields[] = {
      {kFirst, 0, DER_FIELD_OPTIONAL | DER_FIELD_SKIP_TAG_CHECK},
      {kSecond, DER_TAG_INTEGER, 0},
  };
  Record r;
  EXPECT_EQ(DERParseSequenceContent(slice(kInteger), 2, fields, &r, sizeof r),
            DER_STATUS_INCOMPLETE_SEQUENCE);
}

TEST(DERParseSequenceContent, SkipWriteConsumesWithoutWriting) {
  const DERFieldSpec fields[] = {
      {kFirst, DER_TAG_INTEGER, DER_FIELD_SKIP_WRITE},
      {kSecond, DER_TAG_BOOLEAN, 0},
  };
  const Bytes content = cat({kInteger, kTrue});
  Record r = filledRecord();
  ASSERT_EQ(DERParseSequenceContent(slice(content), 2, fields, &r, sizeof r), DER_STATUS_OK);
  EXPECT_TRUE(isNull(r.first));
  EXPECT_EQ(r.second.data, content.data() + 5);

  // With nothing to write and nothing to clear, no destination is needed at all.
  const DERFieldSpec discard[] = {{0, 0, DER_FIELD_SKIP_TAG_CHECK | DER_FIELD_SKIP_WRITE}};
  EXPECT_EQ(DERParseSequenceContent(slice(kOctets), 1, discard, nullptr, 0), DER_STATUS_OK);
}

TEST(DERParseSequenceContent, KeepHeaderCoversTheWholeItem) {
  const Bytes longOctets = cat({{0x04, 0x81, 0x03}, repeat(0x11, 3)});
  const DERFieldSpec fields[] = {
      {kFirst, DER_TAG_INTEGER, DER_FIELD_KEEP_HEADER},
      {kSecond, DER_TAG_OCTET_STRING, DER_FIELD_KEEP_HEADER},
      {kThird, DER_TAG_BOOLEAN, 0},
  };
  const Bytes content = cat({kInteger, longOctets, kTrue});
  Record r;
  ASSERT_EQ(DERParseSequenceContent(slice(content), 3, fields, &r, sizeof r), DER_STATUS_OK);
  EXPECT_EQ(r.first.data, content.data());
  EXPECT_EQ(r.first.length, kInteger.size());
  EXPECT_EQ(r.second.data, content.data() + kInteger.size());
  EXPECT_EQ(r.second.length, longOctets.size());
  EXPECT_EQ(r.third.data, content.data() + kInteger.size() + longOctets.size() + 2);
  EXPECT_EQ(r.third.length, 1u);
}

TEST(DERParseSequenceContent, DestinationSizeZeroLeavesUnwrittenBytes) {
  Record r = filledRecord();
  ASSERT_EQ(DERParseSequenceContent(slice(kInteger), 2, kIntThenOptionalBool, &r, 0),
            DER_STATUS_OK);
  EXPECT_EQ(r.first.length, 1u);
  EXPECT_EQ(r.extra, 0x5A5A5A5Au);
  EXPECT_NE(r.second.length, 0u);
}

TEST(DERParseSequenceContent, DestinationSizeClearsOnlyThatMany) {
  Record r = filledRecord();
  ASSERT_EQ(DERParseSequenceContent(slice(kInteger), 2, kIntThenOptionalBool, &r,
                                    offsetof(Record, extra)),
            DER_STATUS_OK);
  EXPECT_TRUE(isNull(r.second));
  EXPECT_EQ(r.extra, 0x5A5A5A5Au);
}

TEST(DERParseSequenceContent, RowsThatDoNotFitTheDestinationAreRefused) {
  Record r = filledRecord();
  const DERFieldSpec pastTheEnd[] = {
      {kFirst, DER_TAG_INTEGER, DER_FIELD_OPTIONAL},
      {sizeof(Record) - sizeof(DERSlice) + 1, DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL},
  };
  // Refused before any item is read, whatever the content holds.
  EXPECT_EQ(DERParseSequenceContent(slice(kInteger), 2, pastTheEnd, &r, sizeof r),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseSequenceContent(DERSlice{}, 2, pastTheEnd, &r, sizeof r),
            DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(r.extra, 0u);  // cleared all the same

  const DERFieldSpec hugeOffset[] = {{~std::uint64_t{0} - 4, DER_TAG_INTEGER, 0}};
  EXPECT_EQ(DERParseSequenceContent(slice(kInteger), 1, hugeOffset, &r, sizeof r),
            DER_STATUS_DECODE_ERROR);

  // A row that writes nothing may point anywhere, and the last slot fits exactly.
  const DERFieldSpec fits[] = {
      {~std::uint64_t{0}, DER_TAG_INTEGER, DER_FIELD_SKIP_WRITE},
      {sizeof(Record) - sizeof(DERSlice), DER_TAG_BOOLEAN, 0},
  };
  const Bytes content = cat({kInteger, kTrue});
  ASSERT_EQ(DERParseSequenceContent(slice(content), 2, fits, &r, sizeof r), DER_STATUS_OK);
  DERSlice last;
  std::memcpy(&last, reinterpret_cast<const std::uint8_t*>(&r) + sizeof(Record) - sizeof(DERSlice),
              sizeof last);
  EXPECT_EQ(last.data, content.data() + 5);
}

TEST(DERParseSequenceContent, UnalignedOffsetsAreWritten) {
  alignas(8) std::uint8_t record[1 + sizeof(DERSlice)] = {};
  const DERFieldSpec fields[] = {{1, DER_TAG_INTEGER, 0}};
  ASSERT_EQ(DERParseSequenceContent(slice(kInteger), 1, fields, record, sizeof record),
            DER_STATUS_OK);
  DERSlice written;
  std::memcpy(&written, record + 1, sizeof written);
  EXPECT_EQ(written.length, 1u);
  EXPECT_EQ(*written.data, 0x2A);
  EXPECT_EQ(record[0], 0);
}

TEST(DERParseSequenceContent, ManyItemsAgainstALongTemplate) {
  constexpr int kCount = 1000;
  std::vector<DERFieldSpec> fields;
  Bytes content;
  for (int i = 0; i < kCount; ++i) {
    fields.push_back({static_cast<std::uint64_t>(i) * sizeof(DERSlice), DER_TAG_INTEGER, 0});
    content.insert(content.end(), {0x02, 0x01, static_cast<std::uint8_t>(i & 0x7F)});
  }
  std::vector<DERSlice> record(kCount);
  ASSERT_EQ(DERParseSequenceContent(slice(content), kCount, fields.data(), record.data(),
                                    record.size() * sizeof(DERSlice)),
            DER_STATUS_OK);
  for (int i = 0; i < kCount; ++i) {
    ASSERT_EQ(record[i].data, content.data() + 3 * i + 2);
  }
}

}  // namespace
