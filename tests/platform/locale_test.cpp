#include <gtest/gtest.h>

#include "platform/locale.h"

TEST(Locale, AvailableIdentifiersComeFromICUAndCompareExactly) {
  EXPECT_GT(platform::availableLocaleIdentifiers().size(), 100u);
  for (const char* id : {"en_US", "fr_FR", "zh_Hans_CN", "ja_JP", "en"}) EXPECT_TRUE(platform::isAvailableLocaleIdentifier(id)) << id;
  for (const char* id : {"en-US", "EN_US", "xx_YY", "", "en_US "}) EXPECT_FALSE(platform::isAvailableLocaleIdentifier(id)) << id;
  EXPECT_EQ(platform::Locale("de_DE").localeIdentifier(), "de_DE");
}
