#include <gtest/gtest.h>

#include <cstring>

#include "support/hex.h"

using platform::Data;
using platform::Value;

TEST(Hex, StringToDataFiltersNonHexAndDropsAnOddDigit) {
  EXPECT_EQ(convertNSStringToNSData("0A:bc ff")->toVector(), (std::vector<uint8_t>{0x0a, 0xbc, 0xff}));
  EXPECT_EQ(convertNSStringToNSData("abc")->toVector(), (std::vector<uint8_t>{0xab}));
  ASSERT_TRUE(convertNSStringToNSData(""));
  EXPECT_TRUE(convertNSStringToNSData("")->empty());
  EXPECT_TRUE(convertNSStringToNSData("xyz-")->empty());
  EXPECT_FALSE(convertNSStringToNSData(std::nullopt));
  // Multi-byte characters are not hex digits and vanish.
  EXPECT_EQ(convertNSStringToNSData("é1é2")->toVector(), (std::vector<uint8_t>{0x12}));
}

TEST(Hex, AsciiToHexWritesWholePairsOnlyAndReadsJunkAsZero) {
  uint8_t out[4] = {0xEE, 0xEE, 0xEE, 0xEE};
  ascii_to_hex(out, "1", 1);
  EXPECT_EQ(out[0], 0xEE);
  ascii_to_hex(out, "", 0);
  EXPECT_EQ(out[0], 0xEE);
  ascii_to_hex(out, "fFzg9", 5);
  EXPECT_EQ(out[0], 0xFF);
  EXPECT_EQ(out[1], 0x00);
  EXPECT_EQ(out[2], 0xEE);
}

TEST(Hex, DataToStringUsesTheCallersFormatWithoutSeparators) {
  Value bytes(Data(std::vector<uint8_t>{0x01, 0xab}));
  EXPECT_EQ(convertNSDataToNSString(bytes, "%02X"), "01AB");
  EXPECT_EQ(convertNSDataToNSString(bytes, "%02x "), "01 ab ");
  EXPECT_EQ(convertNSDataToNSString(Value(Data()), "%02x"), "");
  EXPECT_EQ(convertNSDataToNSString(std::nullopt, "%02x"), std::nullopt);
  EXPECT_EQ(convertNSDataToNSString(Value("0102"), "%02x"), std::nullopt);
}

TEST(Hex, PrintBytesWritesNothingForNoBytes) {
  testing::internal::CaptureStdout();
  const uint8_t b[] = {0xde, 0xad};
  printBytes(nullptr, 2, "%02x", true);
  printBytes(b, 0, "%02x", true);
  printBytes(b, 2, "%02x", false);
  printBytes(b, 1, "<%u>", true);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "dead<222>\n");
}

TEST(Hex, RemoveNewlineCutsOneLineFeedOnly) {
  char a[] = "line\n\n";
  EXPECT_STREQ(removeNewline(a), "line\n");
  char b[] = "crlf\r\n";
  EXPECT_STREQ(removeNewline(b), "crlf\r");
  char c[] = "cr\r";
  EXPECT_STREQ(removeNewline(c), "cr\r");
  char d[] = "";
  EXPECT_EQ(removeNewline(d), d);
  EXPECT_STREQ(d, "");
  EXPECT_EQ(removeNewline(nullptr), nullptr);
}
