#include <gtest/gtest.h>

#include "platform/base64.h"

using platform::base64DecodeStrict;
using platform::base64Encode;
using platform::Data;

TEST(Base64, EncodesRfc4648Vectors) {
  const char* plain[] = {"", "f", "fo", "foo", "foob", "fooba", "foobar"};
  const char* coded[] = {"", "Zg==", "Zm8=", "Zm9v", "Zm9vYg==", "Zm9vYmE=", "Zm9vYmFy"};
  for (int i = 0; i < 7; ++i) {
    EXPECT_EQ(base64Encode(Data::fromString(plain[i]).span()), coded[i]);
    auto back = base64DecodeStrict(coded[i]);
    ASSERT_TRUE(back) << coded[i];
    EXPECT_EQ(back->view(), plain[i]);
  }
}

TEST(Base64, BinaryRoundTripUsesTheStandardAlphabet) {
  std::vector<uint8_t> all(256);
  for (int i = 0; i < 256; ++i) all[i] = static_cast<uint8_t>(i);
  std::string text = base64Encode(all);
  EXPECT_NE(text.find('+'), std::string::npos);
  EXPECT_NE(text.find('/'), std::string::npos);
  EXPECT_EQ(text.find('\n'), std::string::npos);
  EXPECT_EQ(base64DecodeStrict(text)->toVector(), all);
}

TEST(Base64, StrictDecodingRefusesAnythingUnusual) {
  for (const char* bad : {"AQI", "AQI=\n", " AQI=", "AQ I=", "A===", "=AAA", "AQ=I", "AQI-", "AQI_", "Zg=a", "Zm9v\r\n"})
    EXPECT_FALSE(base64DecodeStrict(bad)) << bad;
}
