// The helpers' leniencies: what each one accepts without a word, and what it quietly drops.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cmath>
#include <filesystem>
#include <fstream>
#include <vector>

#include "platform/config/device_facts.h"
#include "support/base64_array.h"
#include "support/hex.h"
#include "support/json_file.h"
#include "support/obfuscated_pointer.h"
#include "support/objects.h"
#include "support/system_info.h"
#include "support/unicode.h"

using platform::Array;
using platform::Data;
using platform::Dictionary;
using platform::Value;

namespace {

TEST(Hex, TextToBytesSkipsEveryNonDigitAndAnOddLastDigit) {
  // clang-format off
  const std::pair<std::optional<std::string>, std::optional<std::string>> rows[] = {
      {"0A:bc ff", "\x0a\xbc\xff"}, {"09afAF", "\x09\xaf\xaf"}, {"abc", "\xab"}, {"", ""},
      {"/:@G`g-x", ""},  // the neighbours of each digit range
      {"é1é2", "\x12"}, {std::nullopt, std::nullopt},
  };
  // clang-format on
  for (const auto& [text, expected] : rows)
    EXPECT_EQ(convertNSStringToNSData(text), expected ? std::optional(Data::fromString(*expected)) : std::nullopt)
        << text.value_or("(none)");
  uint8_t out[3] = {0xEE, 0xEE, 0xEE};
  ascii_to_hex(out + 2, "1", 1);  // whole pairs only
  ascii_to_hex(out, "fFzg9", 5);  // anything else reads as 0
  EXPECT_EQ(std::vector<uint8_t>(out, out + 3), (std::vector<uint8_t>{0xFF, 0x00, 0xEE}));
}

TEST(Hex, BytesToTextUsesTheCallersFormatAndPrintingSkipsNoBytes) {
  const Value two(Data(std::vector<uint8_t>{0x01, 0xab}));
  EXPECT_EQ(convertNSDataToNSString(two, "%02X"), "01AB");
  EXPECT_EQ(convertNSDataToNSString(two, "%02x "), "01 ab ");
  EXPECT_EQ(convertNSDataToNSString(Value(Data()), "%02x"), "");
  for (const auto& refused : {std::optional<Value>(), std::optional(Value("0102"))})  // bytes only
    EXPECT_EQ(convertNSDataToNSString(refused, "%02x"), std::nullopt);
  EXPECT_EQ(convertNSDataToNSString(two, nullptr), std::nullopt);
  testing::internal::CaptureStdout();
  const uint8_t b[] = {0xde, 0xad};
  printBytes(nullptr, 2, "%02x", true);
  printBytes(b, 0, "%02x", true);
  printBytes(b, 2, "%02x", false);
  printBytes(b, 1, "<%u>", true);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "dead<222>\n");
  for (auto [text, expected] : {std::pair{"a\n\n", "a\n"}, {"crlf\r\n", "crlf\r"}, {"cr\r", "cr\r"}, {"", ""}}) {
    std::string buffer = text;
    EXPECT_STREQ(removeNewline(buffer.data()), expected);  // cuts one line feed and nothing else
  }
  EXPECT_EQ(removeNewline(nullptr), nullptr);
}

TEST(Base64Array, EncodesEachElementAndDropsWhatDoesNotDecode) {
  EXPECT_EQ(base64EncodeArray(std::vector<Data>{Data::fromString("\x01\x02"), Data(), Data::fromString("\xff")}),
            (std::vector<std::string>{"AQI=", "", "/w=="}));
  EXPECT_TRUE(base64EncodeArray(std::nullopt).empty());
  EXPECT_EQ(base64DecodeArray({"AQI=", "AQ I=", "AAA=", "*"}),
            (std::vector<Data>{Data::fromString("\x01\x02"), Data::fromString(std::string(2, '\0'))}));
}

TEST(Unicode, TrimsOnlyTheEmbeddingAndOverrideControlsAndOnlyAtTheEnds) {
  const std::string lre = "\u202A", rle = "\u202B", pdf = "\u202C", lro = "\u202D", rlo = "\u202E", lri = "\u2066";
  // clang-format off
  const std::pair<std::string, std::string> trims[] = {
      {rle + "abc" + pdf, "abc"}, {lre + lro + rle + "a" + pdf + "b" + lro + lre, "a" + pdf + "b"},  // ends only
      {rlo + "abc", rlo + "abc"}, {lri + "abc" + pdf, lri + "abc"},  // the override and the isolates stay
      {pdf + pdf, ""}, {"", ""}, {"abc\xE2\x80", "abc\xE2\x80"},  // a truncated sequence is no control
  };
  // clang-format on
  for (const auto& [text, trimmed] : trims) EXPECT_EQ(trimBidirectionalUnicodeCharacters(text), trimmed);
}

TEST(Objects, AbsentAndNullAreNullAndConformanceUsesTheInstanceTestForClassMethodsToo) {
  EXPECT_TRUE(isNSObjectNull(std::nullopt) && isNSObjectNull(Value()));
  EXPECT_FALSE(isNSObjectNull(Value(0)) || isNSObjectNull(Value("")));
  EXPECT_EQ(NSObjectIfNotNull(Value()), std::nullopt);
  EXPECT_EQ(NSObjectIfNotNull(Value(false)), Value(false));
  EXPECT_TRUE(isNSObjectEqual(std::nullopt, std::nullopt) && isNSObjectEqual(Value(Array{1}), Value(Array{1.0})));
  EXPECT_FALSE(isNSObjectEqual(std::nullopt, Value()) || isNSObjectEqual(Value(), std::nullopt) ||
               isNSObjectEqual(Value(1), Value(2)));

  // A class method of C does not count: instances do not answer it.
  platform::Protocol proto{"P", {{"a", true, true}, {"b", true, true}, {"c", false, true}, {"make", true, false}}};
  platform::ClassDescription cls{"C", {"a", "c"}, {"make"}};
  std::set<std::string> missing = {"stale"};
  EXPECT_FALSE(classImplementsMethodsInProtocol(cls, proto, true, true, &missing));
  EXPECT_EQ(missing, (std::set<std::string>{"b"}));
  EXPECT_TRUE(classImplementsMethodsInProtocol(cls, proto, false, true, &missing));
  EXPECT_TRUE(missing.empty());
  EXPECT_FALSE(classImplementsMethodsInProtocol(cls, proto, true, false, &missing));
  EXPECT_EQ(missing, (std::set<std::string>{"make"}));
}

// What may be written and how a document is parsed are the JSON codec's rules.
TEST(JSONFile, IsWrittenWholeAndPrettyOrNotAtAllAndUnreadableOnesReadAsNothing) {
  const auto dir = std::filesystem::temp_directory_path() / ("zlka-json-" + std::to_string(getpid()));
  std::filesystem::create_directories(dir);
  const auto path = dir / "f.json";
  ASSERT_TRUE(writeJSONFile(std::nullopt, path));  // no object writes {}
  EXPECT_EQ(readJSONFile(path), Value(Dictionary{}));
  const Value v(Dictionary{{"a", Array{1, "x"}}, {"b", true}});
  ASSERT_TRUE(writeJSONFile(v, path));
  EXPECT_EQ(readJSONFile(path), v);
  EXPECT_FALSE(writeJSONFile(Value(Array{Data::fromString("x")}), path) || writeJSONFile(v, std::nullopt) ||
               writeJSONFile(v, dir / "no-such-dir" / "f.json"));
  std::ifstream in(path);
  EXPECT_EQ(std::string(std::istreambuf_iterator<char>(in), {}),
            "{\n  \"a\": [\n    1,\n    \"x\"\n  ],\n  \"b\": true\n}");
  EXPECT_FALSE(readJSONFile(dir / "absent.json") || readJSONFile(dir) || readJSONFile(std::nullopt));
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir), {}), 1);  // no temporary left
  std::filesystem::remove_all(dir);
}

TEST(SystemInfo, ClockRoundsHalvesAwayFromZeroAndMemoryUseWritesOnlyTheGivenPointers) {
  using systemInfo_detail::roundedUnixTime;
  const std::tuple<double, double, uint64_t> rows[] = {{10.5, 1, 11}, {10.49, 1, 10}, {1.0005, 1000, 1001}, {0.4, 1, 0},
                                                       {0, 1, 0},     {-3, 1000, 0},  {std::nan(""), 1, 0}};
  for (const auto& [seconds, scale, expected] : rows) EXPECT_EQ(roundedUnixTime(seconds, scale), expected) << seconds;
  const uint64_t s = systemInfo_getCurrentUnixTime(), ms = systemInfo_getCurrentUnixTimeMS();
  EXPECT_TRUE(s > 1'700'000'000u && ms / 1000 <= s + 1 && ms / 1000 + 1 >= s) << s << " " << ms;
  uint64_t resident = 0, virt = 0, footprint = 0;
  ASSERT_TRUE(getMemoryUse(&resident, nullptr, nullptr) && getMemoryUse(nullptr, &virt, &footprint) &&
              getMemoryUse(nullptr, nullptr, nullptr));
  EXPECT_TRUE(resident > 0 && virt >= resident && footprint > 0);
  std::vector<char> block(64 << 20, 1);  // touched, so resident and anonymous
  uint64_t grown = 0;
  ASSERT_TRUE(getMemoryUse(nullptr, nullptr, &grown) && block[12345] == 1);
  EXPECT_GT(grown, footprint + (32u << 20));
}

TEST(SystemInfo, InternalBuildIsAskedOnceAndDeviceClassEveryTime) {
  EXPECT_EXIT(
      {
        platform::setDeviceFacts({true, "Hub"});
        bool first = systemInfo_isInternalBuild();
        platform::setDeviceFacts({false, "Other"});
        std::exit(first && systemInfo_isInternalBuild() && systemInfo_copyDeviceClass() == "Other" ? 0 : 1);
      },
      testing::ExitedWithCode(0), "");
}

TEST(ObfuscatedPointer, KeepsNullAndDistancesButHidesAddresses) {
  char buffer[16] = {};
  const uintptr_t a = obfuscatedPointer(buffer);
  EXPECT_EQ(obfuscatedPointer(buffer + 10) - a, 10u);
  EXPECT_NE(a, reinterpret_cast<uintptr_t>(buffer));
  EXPECT_EQ(obfuscatedPointer(buffer), a);  // the offset is drawn once
  // Not the first value of an unseeded random(), the same in every process (1 in 2^31 to fail).
  EXPECT_NE(a - reinterpret_cast<uintptr_t>(buffer), 0x6b8b4567u);
  EXPECT_EQ(obfuscatedPointer(nullptr), 0u);
}

}  // namespace
