// The DER decoder's statuses, one table per function; how sequences are walked and templates
// matched is left to the sequence fuzz target's model. Inputs are hex in groups: "G*N" is the
// group G N times, and a "|" group ends the slice handed to the decoder while the bytes after it
// stay in the buffer, so that a read past the slice would see a well-formed continuation.
#include "der/der.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <limits>
#include <sstream>
#include <string>
#include <vector>

namespace {

constexpr DERStatus OK = DER_STATUS_OK;
constexpr DERStatus BAD = DER_STATUS_DECODE_ERROR;
constexpr DERStatus OVER = DER_STATUS_OVERFLOW;
constexpr DERTag kCtx = DER_TAG_CLASS_CONTEXT_SPECIFIC;
constexpr DERTag kPriv = DER_TAG_CLASS_PRIVATE;
constexpr DERTag kCons = DER_TAG_CONSTRUCTED;
constexpr std::uint64_t kMax64 = std::numeric_limits<std::uint64_t>::max();

struct Input {
  std::vector<std::uint8_t> buffer;
  std::size_t size = 0;
  DERSlice slice() const { return DERSlice{buffer.data(), size}; }
  const std::uint8_t* at(std::size_t offset) const { return buffer.data() + offset; }
};

Input hex(const std::string& text) {
  Input in{{}, std::string::npos};
  std::istringstream groups(text);
  for (std::string g; groups >> g;) {
    if (g == "|") {
      in.size = in.buffer.size();
      continue;
    }
    const std::size_t digits = std::min(g.find('*'), g.size());
    const std::size_t count = digits < g.size() ? std::stoul(g.substr(digits + 1)) : 1;
    for (std::size_t n = 0; n < count; ++n) {
      for (std::size_t i = 0; i < digits; i += 2) in.buffer.push_back(std::stoul(g.substr(i, 2), nullptr, 16));
    }
  }
  if (in.size == std::string::npos) in.size = in.buffer.size();
  return in;
}

// What a failing call must leave as it was.
const std::uint8_t kMarker = 0xEE;
constexpr DERDecodedItem kSentinel{0x1234, DERSlice{&kMarker, 77}};

// The numbers are the decoder's ABI (4 and 6 reserved); two equal ones would hide a status.
TEST(DERStatus, NumbersAreFixed) {
  const std::vector<int> numbers{OK,  DER_STATUS_END_OF_SEQUENCE,     DER_STATUS_UNEXPECTED_TAG,
                                 BAD, DER_STATUS_INCOMPLETE_SEQUENCE, OVER};
  EXPECT_EQ(numbers, (std::vector<int>{0, 1, 2, 3, 5, 7}));
}

// ---- Items ---------------------------------------------------------------------------------

struct ItemRow {
  const char* hex;
  DERStatus status;
  DERTag tag = 0;
  std::size_t contentOffset = 0;
  std::uint64_t contentLength = 0;  // within the input
  std::uint64_t overrun = 0;        // the declared length, when the content runs past the input
};

// clang-format off
const ItemRow kItems[] = {
    {"3000", OK, DER_TAG_SEQUENCE, 2, 0},
    {"0201 05 FFFFFF", OK, DER_TAG_INTEGER, 2, 1},  // bytes after the item are ignored
    {"4100", OK, DER_TAG_CLASS_APPLICATION | 1, 2, 0},
    {"FE00", OK, kPriv | kCons | 30, 2, 0},
    {"1F1F 00", OK, 31, 3, 0},
    {"1F818001 00", OK, (1u << 14) | 1u, 5, 0},
    {"9F8100 02 AABB", OK, kCtx | 128, 4, 2},
    {"1F9FFFFFFFFFFFFFFF7F 00", OK, DER_TAG_NUMBER_MASK, 11, 0},  // 2^61 - 1 in nine groups
    {"30 82012C 05*300", OK, DER_TAG_SEQUENCE, 4, 300},
    {"04 8105 AB*5", OK, DER_TAG_OCTET_STRING, 3, 5},  // long form below 128, accepted on purpose
    {"", BAD},                        // no identifier
    {"30", BAD},                      // no length octet
    {"1F1E 00", BAD},                 // high-tag form for a number that fits the short form
    {"1F8001 00", BAD},               // high-tag number with a leading zero group
    {"1F | 818101 00", BAD},          // slice ends before the tag number
    {"1F8181 | 01 00", BAD},          // slice ends inside the tag number
    {"1F818101 | 00", BAD},           // slice ends before the length octet
    {"1FA0808080808080800000", BAD},  // 2^61 would read as the constructed flag
    {"1F84 80*8 00 00", BAD},         // ten groups: wider than 64 bits
    {"1F FF*4096 00", BAD},           // an endless run of continuation groups
    {"04 8100", BAD},                 // long-form length with a leading zero byte
    {"0480", BAD},                    // indefinite length
    {"04 89 01*9", BAD},              // more than eight length bytes
    {"04 82 | 0100 00", BAD},         // slice ends inside the length octets
    {"0405 0102", BAD, DER_TAG_OCTET_STRING, 2, 2, 5},         // content longer than the input
    {"0403 0102 | 03", BAD, DER_TAG_OCTET_STRING, 2, 2, 3},    // bounded by the slice, not the buffer
    {"04 88 FF*8", BAD, DER_TAG_OCTET_STRING, 10, 0, kMax64},  // length octets end the input
};
// clang-format on

bool same(const DERDecodedItem& a, const DERDecodedItem& b) {
  return a.tag == b.tag && a.content.data == b.content.data && a.content.length == b.content.length;
}

// The other partial decoder, and the agreement of all three, are the item fuzz target's properties.
TEST(DERDecodeItem, DecodesOrRefusesEachItemStrictlyOrPartially) {
  for (const ItemRow& row : kItems) {
    SCOPED_TRACE(row.hex);
    const Input in = hex(row.hex);
    const DERDecodedItem content{row.tag, {in.at(row.contentOffset), row.contentLength}};
    DERDecodedItem item = kSentinel;
    EXPECT_EQ(DERDecodeItem(in.slice(), &item), row.status);
    EXPECT_TRUE(same(item, row.status == OK ? content : kSentinel));
    // Partial: a content that runs past the input is accepted, clipped, with its declared length.
    const bool partial = row.status == OK || row.overrun != 0;
    std::uint64_t declared = 99;
    item = kSentinel;
    EXPECT_EQ(DERDecodeItemPartialBufferGetLength(in.slice(), &item, &declared), partial ? OK : row.status);
    EXPECT_TRUE(same(item, partial ? content : kSentinel));
    EXPECT_EQ(declared, row.overrun != 0 ? row.overrun : partial ? row.contentLength : 99);
  }
}

// ---- Primitives ----------------------------------------------------------------------------

struct PrimitiveRow {
  const char* hex;
  DERStatus status;
  std::uint64_t value = 0;
};

// clang-format off
const PrimitiveRow kBooleans[] = {
    {"00", OK, false},
    {"FF", OK, true},
    {"01", BAD},    // only 0x00 and 0xFF are booleans
    {"", BAD},      // not exactly one byte
    {"FFFF", BAD},
};
// clang-format on

TEST(DERParseBoolean, OnlyOneByteOfZeroOrAllOnesIsABoolean) {
  for (const PrimitiveRow& row : kBooleans) {
    SCOPED_TRACE(row.hex);
    const Input in = hex(row.hex);
    // Start from the opposite of any result, so that every write shows.
    bool value = true, defaulted = true;
    ASSERT_EQ(DERParseBoolean(in.slice(), &value), row.status);
    EXPECT_EQ(value, row.status != OK || row.value != 0);
    // With a default, only the empty content differs: it gives the default.
    ASSERT_EQ(DERParseBooleanWithDefault(in.slice(), false, &defaulted), in.size == 0 ? OK : row.status);
    EXPECT_EQ(defaulted, in.size != 0 && value);
  }
}

// clang-format off
const PrimitiveRow kIntegers[] = {
    {"00 | 00", OK, 0},             // a read past the content would see a non-minimal zero
    {"7F", OK, 127},
    {"0080", OK, 128},
    {"00FFFFFFFF", OK, 0xFFFFFFFF},
    {"0100000000", OK, 0x100000000},  // too wide for 32 bits
    {"0102030405060708", OK, 0x0102030405060708},
    {"0080 00*7", OK, 0x8000000000000000},
    {"00 FF*8", OK, kMax64},
    {"", BAD},                      // no content
    {"FF", BAD},                    // negative
    {"FF*12", BAD},                 // negative wins over too wide
    {"007F", BAD},                  // non-minimal leading zero
    {"00*12", BAD},                 // non-minimal wins over too wide
    {"01 00*8", OVER},              // nine significant bytes
    {"0080 00*8", OVER},            // ten bytes, the first zero
};
// clang-format on

TEST(DERParseInteger, UnsignedMinimalIntegersOfEachWidth) {
  for (const PrimitiveRow& row : kIntegers) {
    SCOPED_TRACE(row.hex);
    const Input in = hex(row.hex);
    std::uint64_t wide = 99;
    ASSERT_EQ(DERParseInteger64(in.slice(), &wide), row.status);
    EXPECT_EQ(wide, row.status == OK ? row.value : 99u);
    const DERStatus narrowStatus = row.status == OK && row.value > 0xFFFFFFFF ? OVER : row.status;
    std::uint32_t narrow = 99;
    ASSERT_EQ(DERParseInteger(in.slice(), &narrow), narrowStatus);
    EXPECT_EQ(narrow, narrowStatus == OK ? row.value : 99u);
  }
}

// ---- Sequence templates: what the destination size allows -----------------------------------

// A destination whose every byte a parse is to write or clear holds something else first.
struct Record {
  DERSlice field[3] = {{&kMarker, 7}, {&kMarker, 7}, {&kMarker, 7}};
  std::uint32_t extra = 0x5A5A5A5A;  // no row names it
};

TEST(DERParseSequenceContent, DestinationSizeBoundsClearingAndWriting) {
  const Input content = hex("02012A");
  const DERFieldSpec intOptBool[] = {{0, DER_TAG_INTEGER, 0}, {sizeof(DERSlice), DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL}};
  Record r;
  // Nothing is cleared when the sequence itself does not decode.
  EXPECT_EQ(DERParseSequence(hex("3003 0201").slice(), 2, intOptBool, &r, sizeof r), BAD);
  // 0: offsets are trusted and nothing is cleared.
  ASSERT_EQ(DERParseSequenceContent(content.slice(), 2, intOptBool, &r, 0), OK);
  EXPECT_EQ(r.field[0].data, content.at(2));
  EXPECT_TRUE(r.field[1].length == 7 && r.extra == 0x5A5A5A5Au);
  // Otherwise only the first destSize bytes are cleared.
  ASSERT_EQ(DERParseSequenceContent(content.slice(), 2, intOptBool, &r, offsetof(Record, extra)), OK);
  EXPECT_TRUE(r.field[1].data == nullptr && r.extra == 0x5A5A5A5Au);

  // A row that would write past destSize is refused before any item is read, after clearing.
  constexpr std::uint64_t kSize = offsetof(Record, extra), kLastSlot = offsetof(Record, field[2]);
  for (const std::uint64_t offset : {kLastSlot + 1, kMax64 - 4}) {
    const DERFieldSpec badFirst[] = {{offset, DER_TAG_INTEGER, DER_FIELD_OPTIONAL}, {0, DER_TAG_BOOLEAN, 0}};
    const DERFieldSpec badSecond[] = {{0, DER_TAG_INTEGER, 0}, {offset, DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL}};
    for (const DERFieldSpec* layout : {badFirst, badSecond}) {
      r.field[0].length = 7;
      EXPECT_EQ(DERParseSequenceContent(content.slice(), 2, layout, &r, kSize), BAD);
      EXPECT_EQ(r.field[0].length, 0u);
    }
  }
  // A row that writes nothing may point anywhere, and the last slot fits exactly. (The option
  // bits are distinct: an optional row is neither kept whole nor free of its tag.)
  const Input two = hex("02012A 0101FF");
  const DERFieldSpec fits[] = {{kMax64, DER_TAG_INTEGER, DER_FIELD_SKIP_WRITE},
                               {kLastSlot, DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL}};
  ASSERT_EQ(DERParseSequenceContent(two.slice(), 2, fits, &r, kSize), OK);
  EXPECT_EQ(r.field[2].data, two.at(5));
  const DERFieldSpec optBoolInt[] = {{0, DER_TAG_BOOLEAN, DER_FIELD_OPTIONAL}, {0, DER_TAG_INTEGER, 0}};
  EXPECT_EQ(DERParseSequenceContent(content.slice(), 2, optBoolInt, &r, kSize), OK);
  // With nothing to write and nothing to clear, no destination is needed at all.
  const DERFieldSpec discard[] = {{0, 0, DER_FIELD_SKIP_TAG_CHECK | DER_FIELD_SKIP_WRITE}};
  EXPECT_EQ(DERParseSequenceContent(content.slice(), 1, discard, nullptr, 0), OK);
  // Offsets need not be aligned.
  alignas(8) std::uint8_t unaligned[1 + sizeof(DERSlice)] = {};
  const DERFieldSpec odd[] = {{1, DER_TAG_INTEGER, 0}};
  ASSERT_EQ(DERParseSequenceContent(content.slice(), 1, odd, unaligned, sizeof unaligned), OK);
  const DERSlice want{content.at(2), 1};
  EXPECT_EQ(std::memcmp(unaligned + 1, &want, sizeof want), 0);
}

}  // namespace
