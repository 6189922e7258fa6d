#include <gtest/gtest.h>

#include <cstdint>
#include <limits>

#include "der/der_primitives.h"
#include "der_test_util.h"

namespace {

using dertest::Bytes;
using dertest::cat;
using dertest::repeat;
using dertest::slice;

// ---- BOOLEAN -------------------------------------------------------------------------------

TEST(DERParseBoolean, OnlyZeroAndAllOnesAreBooleans) {
  bool value = true;
  ASSERT_EQ(DERParseBoolean(slice({0x00}), &value), DER_STATUS_OK);
  EXPECT_FALSE(value);
  ASSERT_EQ(DERParseBoolean(slice({0xFF}), &value), DER_STATUS_OK);
  EXPECT_TRUE(value);
  for (std::uint8_t byte : {0x01, 0x7F, 0x80, 0xFE}) {
    value = false;
    EXPECT_EQ(DERParseBoolean(slice({byte}), &value), DER_STATUS_DECODE_ERROR) << int{byte};
    EXPECT_FALSE(value);
  }
}

TEST(DERParseBoolean, ContentMustBeExactlyOneByte) {
  bool value = false;
  EXPECT_EQ(DERParseBoolean(DERSlice{}, &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseBoolean(slice({0xFF, 0xFF}), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseBoolean(slice({0x00, 0x00}), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_FALSE(value);
}

TEST(DERParseBooleanWithDefault, EmptyContentGivesTheDefault) {
  bool value = false;
  ASSERT_EQ(DERParseBooleanWithDefault(DERSlice{}, true, &value), DER_STATUS_OK);
  EXPECT_TRUE(value);
  ASSERT_EQ(DERParseBooleanWithDefault(DERSlice{}, false, &value), DER_STATUS_OK);
  EXPECT_FALSE(value);
}

TEST(DERParseBooleanWithDefault, OneByteIsParsedAsABoolean) {
  bool value = false;
  ASSERT_EQ(DERParseBooleanWithDefault(slice({0xFF}), false, &value), DER_STATUS_OK);
  EXPECT_TRUE(value);
  ASSERT_EQ(DERParseBooleanWithDefault(slice({0x00}), true, &value), DER_STATUS_OK);
  EXPECT_FALSE(value);
  EXPECT_EQ(DERParseBooleanWithDefault(slice({0x01}), true, &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseBooleanWithDefault(slice({0xFF, 0xFF}), true, &value),
            DER_STATUS_DECODE_ERROR);
  EXPECT_FALSE(value);
}

// ---- INTEGER -------------------------------------------------------------------------------

TEST(DERParseInteger64, SmallValues) {
  std::uint64_t value = 99;
  ASSERT_EQ(DERParseInteger64(slice({0x00}), &value), DER_STATUS_OK);
  EXPECT_EQ(value, 0u);
  ASSERT_EQ(DERParseInteger64(slice({0x7F}), &value), DER_STATUS_OK);
  EXPECT_EQ(value, 127u);
  ASSERT_EQ(DERParseInteger64(slice({0x00, 0x80}), &value), DER_STATUS_OK);
  EXPECT_EQ(value, 128u);
  ASSERT_EQ(DERParseInteger64(slice({0x01, 0x00}), &value), DER_STATUS_OK);
  EXPECT_EQ(value, 256u);
  ASSERT_EQ(DERParseInteger64(slice({0x00, 0xFF, 0xFF}), &value), DER_STATUS_OK);
  EXPECT_EQ(value, 0xFFFFu);
}

TEST(DERParseInteger64, EmptyContentIsRefused) {
  std::uint64_t value = 99;
  EXPECT_EQ(DERParseInteger64(DERSlice{}, &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(value, 99u);
}

TEST(DERParseInteger64, NegativeNumbersAreRefused) {
  std::uint64_t value = 99;
  EXPECT_EQ(DERParseInteger64(slice({0xFF}), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseInteger64(slice({0x80}), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseInteger64(slice({0x80, 0x00}), &value), DER_STATUS_DECODE_ERROR);
  // Negative wins over too wide.
  EXPECT_EQ(DERParseInteger64(slice(repeat(0xFF, 12)), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(value, 99u);
}

TEST(DERParseInteger64, NonMinimalLeadingZeroIsRefused) {
  std::uint64_t value = 99;
  EXPECT_EQ(DERParseInteger64(slice({0x00, 0x7F}), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseInteger64(slice({0x00, 0x00}), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseInteger64(slice({0x00, 0x00, 0x80}), &value), DER_STATUS_DECODE_ERROR);
  // Non-minimal wins over too wide.
  EXPECT_EQ(DERParseInteger64(slice(repeat(0x00, 12)), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(value, 99u);
}

TEST(DERParseInteger64, EightSignificantBytes) {
  std::uint64_t value = 0;
  ASSERT_EQ(DERParseInteger64(slice({0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}), &value),
            DER_STATUS_OK);
  EXPECT_EQ(value, 0x7FFFFFFFFFFFFFFFu);
  ASSERT_EQ(DERParseInteger64(slice({0x01, 0x02, 0x03, 0x04, 0x05, 0x06, 0x07, 0x08}), &value),
            DER_STATUS_OK);
  EXPECT_EQ(value, 0x0102030405060708u);
}

TEST(DERParseInteger64, NineBytesWithALeadingZeroReachTheTopBit) {
  std::uint64_t value = 0;
  ASSERT_EQ(DERParseInteger64(slice(cat({{0x00, 0x80}, repeat(0x00, 7)})), &value), DER_STATUS_OK);
  EXPECT_EQ(value, 0x8000000000000000u);
  ASSERT_EQ(DERParseInteger64(slice(cat({{0x00}, repeat(0xFF, 8)})), &value), DER_STATUS_OK);
  EXPECT_EQ(value, std::numeric_limits<std::uint64_t>::max());
}

TEST(DERParseInteger64, WiderValuesOverflow) {
  std::uint64_t value = 99;
  EXPECT_EQ(DERParseInteger64(slice(cat({{0x01}, repeat(0x00, 8)})), &value), DER_STATUS_OVERFLOW);
  EXPECT_EQ(DERParseInteger64(slice(cat({{0x7F}, repeat(0xFF, 8)})), &value), DER_STATUS_OVERFLOW);
  EXPECT_EQ(DERParseInteger64(slice(cat({{0x00, 0x80}, repeat(0x00, 8)})), &value),
            DER_STATUS_OVERFLOW);
  EXPECT_EQ(DERParseInteger64(slice(cat({{0x01}, repeat(0x00, 100)})), &value),
            DER_STATUS_OVERFLOW);
  EXPECT_EQ(value, 99u);
}

TEST(DERParseInteger, ThirtyTwoBitRange) {
  std::uint32_t value = 0;
  ASSERT_EQ(DERParseInteger(slice({0x2A}), &value), DER_STATUS_OK);
  EXPECT_EQ(value, 42u);
  ASSERT_EQ(DERParseInteger(slice({0x00, 0xFF, 0xFF, 0xFF, 0xFF}), &value), DER_STATUS_OK);
  EXPECT_EQ(value, 0xFFFFFFFFu);
  ASSERT_EQ(DERParseInteger(slice({0x7F, 0xFF, 0xFF, 0xFF}), &value), DER_STATUS_OK);
  EXPECT_EQ(value, 0x7FFFFFFFu);
}

TEST(DERParseInteger, AboveThirtyTwoBitsOverflows) {
  std::uint32_t value = 99;
  EXPECT_EQ(DERParseInteger(slice({0x01, 0x00, 0x00, 0x00, 0x00}), &value), DER_STATUS_OVERFLOW);
  EXPECT_EQ(DERParseInteger(slice(cat({{0x00}, repeat(0xFF, 8)})), &value), DER_STATUS_OVERFLOW);
  EXPECT_EQ(DERParseInteger(slice(cat({{0x01}, repeat(0x00, 8)})), &value), DER_STATUS_OVERFLOW);
  EXPECT_EQ(value, 99u);
}

TEST(DERParseInteger, SixtyFourBitErrorsArePassedOn) {
  std::uint32_t value = 99;
  EXPECT_EQ(DERParseInteger(DERSlice{}, &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseInteger(slice({0xFF}), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(DERParseInteger(slice({0x00, 0x7F}), &value), DER_STATUS_DECODE_ERROR);
  EXPECT_EQ(value, 99u);
}

// ---- BIT STRING ----------------------------------------------------------------------------

TEST(DERParseBitString, CountThenBits) {
  const Bytes in{0x03, 0xA8, 0xF0};
  DERSlice bits;
  std::uint8_t unused = 99;
  ASSERT_EQ(DERParseBitString(slice(in), &bits, &unused), DER_STATUS_OK);
  EXPECT_EQ(unused, 3);
  EXPECT_EQ(bits.data, in.data() + 1);
  EXPECT_EQ(bits.length, 2u);
}

TEST(DERParseBitString, ShortContentGivesNoBits) {
  const std::uint8_t marker = 0;
  DERSlice bits{&marker, 5};
  std::uint8_t unused = 99;
  ASSERT_EQ(DERParseBitString(slice({0x05}), &bits, &unused), DER_STATUS_OK);  // count dropped
  EXPECT_EQ(unused, 0);
  EXPECT_EQ(bits.data, nullptr);
  EXPECT_EQ(bits.length, 0u);

  bits = DERSlice{&marker, 5};
  unused = 99;
  ASSERT_EQ(DERParseBitString(DERSlice{}, &bits, &unused), DER_STATUS_OK);
  EXPECT_EQ(unused, 0);
  EXPECT_EQ(bits.data, nullptr);
  EXPECT_EQ(bits.length, 0u);
}

TEST(DERParseBitString, CountAndUnusedBitsAreNotChecked) {
  DERSlice bits;
  std::uint8_t unused = 0;
  ASSERT_EQ(DERParseBitString(slice({0x09, 0xFF}), &bits, &unused), DER_STATUS_OK);
  EXPECT_EQ(unused, 9);
  ASSERT_EQ(DERParseBitString(slice({0xFF, 0x01, 0x02}), &bits, &unused), DER_STATUS_OK);
  EXPECT_EQ(unused, 0xFF);
  EXPECT_EQ(bits.length, 2u);
}

}  // namespace
