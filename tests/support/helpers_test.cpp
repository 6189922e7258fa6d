#include <gtest/gtest.h>

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/device_facts.h"
#include "support/base64_array.h"
#include "support/json_file.h"
#include "support/objects.h"
#include "support/obfuscated_pointer.h"
#include "support/system_info.h"
#include "support/unicode.h"

using platform::Array;
using platform::Data;
using platform::Dictionary;
using platform::Value;

TEST(Base64Array, EncodesInOrderAndDropsUndecodableElementsOnDecode) {
  std::vector<Data> in = {Data::fromString("\x01\x02"), Data(), Data::fromString("\xff")};
  EXPECT_EQ(base64EncodeArray(in), (std::vector<std::string>{"AQI=", "", "/w=="}));
  EXPECT_TRUE(base64EncodeArray(std::nullopt).empty());
  EXPECT_TRUE(base64EncodeArray(std::vector<Data>{}).empty());

  auto out = base64DecodeArray({"AQI=", "AQ I=", "AAA="});
  ASSERT_EQ(out.size(), 2u);
  EXPECT_EQ(out[0].toVector(), (std::vector<uint8_t>{1, 2}));
  EXPECT_EQ(out[1].toVector(), (std::vector<uint8_t>{0, 0}));
  EXPECT_TRUE(base64DecodeArray({"AQI=\n", "*"}).empty());
}

TEST(Unicode, TrimsOnlyTheFourControlsAndOnlyAtTheEnds) {
  const std::string lre = "\u202A", rle = "\u202B", pdf = "\u202C", lro = "\u202D", rlo = "\u202E", lri = "\u2066";
  EXPECT_EQ(trimBidirectionalUnicodeCharacters(rle + "abc" + pdf), "abc");
  EXPECT_EQ(trimBidirectionalUnicodeCharacters(lre + lro + rle + "a" + pdf + "b" + lro + lre), "a" + pdf + "b");
  EXPECT_EQ(trimBidirectionalUnicodeCharacters(rlo + "abc"), rlo + "abc");
  EXPECT_EQ(trimBidirectionalUnicodeCharacters(lri + "abc" + pdf), lri + "abc");
  EXPECT_EQ(trimBidirectionalUnicodeCharacters(pdf + pdf), "");
  EXPECT_EQ(trimBidirectionalUnicodeCharacters(""), "");
  // A truncated sequence is not one of the controls.
  EXPECT_EQ(trimBidirectionalUnicodeCharacters("abc\xE2\x80"), "abc\xE2\x80");
}

TEST(Objects, NullAndEquality) {
  EXPECT_TRUE(isNSObjectNull(std::nullopt));
  EXPECT_TRUE(isNSObjectNull(Value()));
  EXPECT_FALSE(isNSObjectNull(Value(0)));
  EXPECT_FALSE(isNSObjectNull(Value("")));
  EXPECT_FALSE(NSObjectIfNotNull(Value()));
  EXPECT_EQ(NSObjectIfNotNull(Value(false)), Value(false));
  EXPECT_TRUE(isNSObjectEqual(std::nullopt, std::nullopt));
  EXPECT_FALSE(isNSObjectEqual(std::nullopt, Value(1)));
  EXPECT_FALSE(isNSObjectEqual(Value(1), std::nullopt));
  EXPECT_TRUE(isNSObjectEqual(Value(Array{1, "a"}), Value(Array{1, "a"})));
  EXPECT_FALSE(isNSObjectEqual(Value(), std::nullopt));
}

TEST(Objects, ProtocolConformanceUsesTheInstanceTestForClassMethodsToo) {
  platform::Protocol proto{"P",
                           {{"a", true, true}, {"b", true, true}, {"c", false, true}, {"make", true, false}}};
  platform::ClassDescription cls{"C", {"a", "c"}, {"make"}};
  std::set<std::string> missing = {"stale"};
  EXPECT_FALSE(classImplementsMethodsInProtocol(cls, proto, true, true, &missing));
  EXPECT_EQ(missing, (std::set<std::string>{"b"}));
  EXPECT_TRUE(classImplementsMethodsInProtocol(cls, proto, false, true, &missing));
  EXPECT_TRUE(missing.empty());
  // "make" is a class method of C, but instances do not answer it.
  EXPECT_FALSE(classImplementsMethodsInProtocol(cls, proto, true, false, &missing));
  EXPECT_EQ(missing, (std::set<std::string>{"make"}));
  EXPECT_TRUE(classImplementsMethodsInProtocol(cls, proto, false, false, nullptr));
}

class JSONFileTest : public testing::Test {
 protected:
  std::filesystem::path dir = std::filesystem::temp_directory_path() / ("zlka-json-" + std::to_string(getpid()));
  void SetUp() override { std::filesystem::create_directories(dir); }
  void TearDown() override { std::filesystem::remove_all(dir); }
};

TEST_F(JSONFileTest, WritesPrettyAtomicallyAndReadsBack) {
  auto path = dir / "f.json";
  Value v(Dictionary{{"a", Array{1, "x"}}, {"b", true}});
  ASSERT_TRUE(writeJSONFile(v, path));
  std::ifstream in(path);
  std::string text((std::istreambuf_iterator<char>(in)), {});
  EXPECT_NE(text.find("\n  \"a\""), std::string::npos);
  EXPECT_EQ(readJSONFile(path), v);
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir), {}), 1);  // no temporary left
}

TEST_F(JSONFileTest, NilObjectWritesAnEmptyObject) {
  auto path = dir / "empty.json";
  ASSERT_TRUE(writeJSONFile(std::nullopt, path));
  EXPECT_EQ(readJSONFile(path), Value(Dictionary{}));
}

TEST_F(JSONFileTest, RefusesWhatJSONCannotHoldAndKeepsTheOldFile) {
  auto path = dir / "keep.json";
  ASSERT_TRUE(writeJSONFile(Value(Array{1}), path));
  EXPECT_FALSE(writeJSONFile(Value("scalar"), path));
  EXPECT_FALSE(writeJSONFile(Value(Array{Data::fromString("x")}), path));
  EXPECT_FALSE(writeJSONFile(Value(Array{1}), std::nullopt));
  EXPECT_FALSE(writeJSONFile(Value(Array{1}), dir / "no-such-dir" / "f.json"));
  EXPECT_EQ(readJSONFile(path), Value(Array{1}));
}

TEST_F(JSONFileTest, ReadingFailsQuietly) {
  EXPECT_FALSE(readJSONFile(std::nullopt));
  EXPECT_FALSE(readJSONFile(dir / "absent.json"));
  std::ofstream(dir / "scalar.json") << "42";
  EXPECT_FALSE(readJSONFile(dir / "scalar.json"));
  std::ofstream(dir / "bad.json") << "{\"a\":";
  EXPECT_FALSE(readJSONFile(dir / "bad.json"));
  EXPECT_FALSE(readJSONFile(dir));  // a directory
}

TEST(SystemInfo, ClockRoundingHalvesAwayFromZero) {
  using systemInfo_detail::roundedUnixTime;
  EXPECT_EQ(roundedUnixTime(10.5, 1), 11u);
  EXPECT_EQ(roundedUnixTime(10.49, 1), 10u);
  EXPECT_EQ(roundedUnixTime(1.0005, 1000), 1001u);
  EXPECT_EQ(roundedUnixTime(0, 1), 0u);
  EXPECT_EQ(roundedUnixTime(-3, 1000), 0u);
  uint64_t s = systemInfo_getCurrentUnixTime();
  uint64_t ms = systemInfo_getCurrentUnixTimeMS();
  EXPECT_GT(s, 1'700'000'000u);
  EXPECT_LE(ms / 1000, s + 1);
  EXPECT_GE(ms / 1000 + 1, s);
}

TEST(SystemInfo, MemoryUseWritesOnlyTheGivenPointers) {
  uint64_t resident = 0, virt = 0, footprint = 0;
  ASSERT_TRUE(getMemoryUse(&resident, nullptr, nullptr));
  EXPECT_GT(resident, 0u);
  ASSERT_TRUE(getMemoryUse(nullptr, &virt, &footprint));
  EXPECT_GE(virt, resident);
  EXPECT_GT(footprint, 0u);
  EXPECT_TRUE(getMemoryUse(nullptr, nullptr, nullptr));
}

TEST(SystemInfo, InternalBuildIsAskedOnceAndDeviceClassEveryTime) {
  EXPECT_EXIT(
      {
        platform::setDeviceFacts({true, "Hub"});
        bool first = systemInfo_isInternalBuild();
        platform::setDeviceFacts({false, "Other"});
        bool ok = first && systemInfo_isInternalBuild() && systemInfo_copyDeviceClass() == "Other";
        std::exit(ok ? 0 : 1);
      },
      testing::ExitedWithCode(0), "");
}

TEST(ObfuscatedPointer, KeepsNullAndDistancesButHidesAddresses) {
  EXPECT_EQ(obfuscatedPointer(nullptr), 0u);
  char buffer[16];
  uintptr_t a = obfuscatedPointer(buffer);
  uintptr_t b = obfuscatedPointer(buffer + 10);
  EXPECT_EQ(b - a, 10u);
  EXPECT_NE(a, reinterpret_cast<uintptr_t>(buffer));
  EXPECT_EQ(obfuscatedPointer(buffer), a);  // the offset is drawn once
  EXPECT_EQ(obfuscatedPointer(nullptr), 0u);
}
