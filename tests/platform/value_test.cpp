#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>

#include "platform/config/locale.h"
#include "platform/values/base64.h"
#include "platform/values/error.h"
#include "platform/values/json.h"
#include "platform/values/uuid.h"

using platform::Array;
using platform::Data;
using platform::Dictionary;
using platform::Value;

namespace {

constexpr uint64_t kU64Max = std::numeric_limits<uint64_t>::max();
std::string nested(int depth) { return std::string(size_t(depth), '[') + std::string(size_t(depth), ']'); }

TEST(Data, ComparesByContentSharesCopiesFreesAnAdoptedBufferOnceAndDescribesLongOnesByTheirEnds) {
  const uint8_t raw[] = {1, 2, 3};
  Data a(raw, 3), copy = a;
  EXPECT_EQ(copy.bytes(), a.bytes());
  EXPECT_TRUE(a == Data(std::vector<uint8_t>{1, 2, 3}) && a != Data(raw, 2) &&
              a != Data(std::vector<uint8_t>{1, 2, 4}));
  EXPECT_EQ(Data(), Data(raw, 0));
  auto* p = static_cast<uint8_t*>(std::malloc(4));
  std::memcpy(p, "abcd", 4);
  EXPECT_EQ(Data(Data::adoptMalloc(p, 4)).view(), "abcd");  // the sanitizer builds catch a leak or a double free
  EXPECT_TRUE(Data::adoptMalloc(nullptr, 0).empty());
  std::string bytes;
  for (int i = 0; i < 49; ++i) bytes += char(i);
  EXPECT_EQ(Data::fromString("\x01\xab").description(), "{length = 2, bytes = 0x01ab}");
  EXPECT_EQ(Data::fromString(bytes.substr(0, 48)).description().find("..."), std::string::npos);
  EXPECT_EQ(Data::fromString(bytes).description(),
            "{length = 49, bytes = 0x000102030405060708090a0b0c0d0e0f1011121314151617 ... 292a2b2c2d2e2f30}");
}

TEST(Value, BooleansEqualOnlyBooleansAndNumbersCompareByValue) {
  struct Row {
    Value a, b;
    bool equal;
  };
  // clang-format off
  const Row rows[] = {
      {true, true, true}, {true, false, false}, {true, 1, false}, {0, false, false},  // read as 0 and 1, equal to neither
      {3, 3.0, true}, {int64_t{5}, uint64_t{5}, true}, {int64_t{0}, uint64_t{0}, true}, {3, 3.5, false}, {uint64_t{2}, 2.0, true},
      {int64_t{-1}, kU64Max, false}, {kU64Max, int64_t{-1}, false},  // no wrap-around
      {"1", 1, false}, {Value(), platform::Null{}, true}, {Value(), 0, false}, {Data::fromString("x"), "x", false},
      {Array{}, Dictionary{}, false}, {platform::Opaque{"fd"}, platform::Opaque{"x"}, false},
      {Dictionary{{"k", Array{1, "x", Value()}}}, Dictionary{{"k", Array{1.0, "x", platform::Null{}}}}, true},
      {Dictionary{{"k", Array{1, "x"}}}, Dictionary{{"k", Array{1, "y"}}}, false},
  };
  const std::pair<Value, bool> truth[] = {{true, true}, {false, false}, {-2, true}, {0, false}, {uint64_t{7}, true},
      {uint64_t{0}, false}, {0.5, true}, {0.0, false}, {"YES", false}, {Value(), false}, {Array{1}, false}};
  // clang-format on
  for (const Row& r : rows) EXPECT_EQ(r.a == r.b, r.equal) << r.a.description() << " vs " << r.b.description();
  for (const auto& [v, t] : truth) EXPECT_EQ(v.boolValue(), t) << v.description();
  EXPECT_EQ(Value(true).numberValue(), 1.0);
  EXPECT_EQ(Value("1").numberValue(), std::nullopt);
}

TEST(Value, MembersAndDescription) {
  Value v(Dictionary{{"a", Array{1, true, "q\"\\\n\x01"}},
                     {"b", Data::fromString("\x0f")},
                     {"c", platform::Opaque{"fd"}},
                     {"d", 0.25},
                     {"e", kU64Max}});
  EXPECT_EQ(v.description(), R"({"a": [1, true, "q\"\\\n\u0001"], "b": {length = 1, bytes = 0x0f}, "c": <fd>, )"
                             R"("d": 0.25, "e": 18446744073709551615})");
  EXPECT_EQ(std::tuple(v.count(), v.find("a")->count(), Value("s").count()), std::tuple(5u, 3u, 0u));
  EXPECT_TRUE(!v.find("missing") && !Value("s").find("a"));
}

TEST(Json, OnlyArraysAndObjectsOfJSONKindsAreWrittenAndTheRoundTripKeepsTheKinds) {
  // clang-format off
  const std::pair<Value, bool> rows[] = {
      {Dictionary{{"a", Array{1, -2.5, "s", true, Value(), kU64Max}}}, true}, {Array{}, true},
      {"top-level string", false}, {1, false}, {Array{Data::fromString("x")}, false},  // bytes have no JSON form
      {Array{std::nan("")}, false}, {Dictionary{{"x", std::numeric_limits<double>::infinity()}}, false},
      {Array{Array{platform::Opaque{"fd"}}}, false},  // found at any depth
  };
  // clang-format on
  for (const auto& [v, valid] : rows) EXPECT_EQ(platform::json::isValidJSONObject(v), valid) << v.description();
  EXPECT_EQ(platform::json::serialize(Value(1)).error(), "Invalid type in JSON write");
  Value v(
      Dictionary{{"b", true}, {"i", -3}, {"u", kU64Max}, {"d", 0.25}, {"n", Value()}, {"s", "é"}, {"a", Array{false}}});
  auto text = platform::json::serialize(v);
  ASSERT_TRUE(text);
  EXPECT_EQ(text->find('\n'), std::string::npos);
  EXPECT_NE(platform::json::serialize(v, true)->find("\n  \"a\""), std::string::npos);
  auto back = platform::json::parse(*text);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, v);  // Booleans stay Booleans: they equal nothing else
  EXPECT_TRUE(back->find("i")->integer() && back->find("u")->unsignedInteger() && back->find("d")->real());
}

TEST(Json, ParsingIsStrictAndBoundsTheNesting) {
  static_assert(platform::json::kMaxDepth == 256);
  // clang-format off
  const std::pair<std::string, bool> rows[] = {
      {" [1] ", true}, {"\"fragment\"", false}, {"3", false},  // the top level is an object or an array
      {"{\"a\":1,}", false}, {"{'a':1}", false}, {"", false}, {"{} trailing", false},
      {"[\"\xff\"]", false},  // not UTF-8
      {nested(256), true}, {nested(257), false},
      {nested(100000), false},  // refused before the recursive conversion could exhaust the stack
      {"[\"" + std::string(1000, '[') + "\"]", true},  // brackets inside strings are no nesting,
      {"[\"\\\"" + std::string(1000, '[') + "\"]", true},  // nor after an escaped quote
  };
  // clang-format on
  for (const auto& [text, ok] : rows) EXPECT_EQ(platform::json::parse(text).ok(), ok) << text.substr(0, 40);
  EXPECT_EQ(platform::json::parse("\"fragment\"").error(), "JSON text did not start with array or object");
}

TEST(Error, UserInfoAbsentIsDistinctFromEmptyAndCarriesTheMessage) {
  platform::Error none("D", -7), empty("D", -7, Dictionary{});
  EXPECT_NE(none, empty);
  EXPECT_EQ(none.description(), R"x(Error Domain=D Code=-7 "The operation couldn't be completed. (D error -7.)")x");
  platform::Error withText("D", -2, Dictionary{{platform::LocalizedDescriptionKey, "msg"}});
  EXPECT_EQ(withText.description(), R"(Error Domain=D Code=-2 "msg" UserInfo={"LocalizedDescription": "msg"})");
  EXPECT_EQ(platform::Error("D", 1, Dictionary{{platform::LocalizedDescriptionKey, 5}}).localizedDescription(),
            "The operation couldn't be completed. (D error 1.)");  // a message that is not text is none
}

TEST(Base64, EncodesTheStandardAlphabetAndDecodesOnlyWhatItWouldWrite) {
  // clang-format off
  const std::pair<std::string, std::optional<std::string>> rows[] = {  // text, the bytes (nullopt: refused)
      {"", ""}, {"Zg==", "f"}, {"Zm8=", "fo"}, {"Zm9v", "foo"}, {"Zm9vYg==", "foob"}, {"Zm9vYmE=", "fooba"},
      {"Zm9vYmFy", "foobar"}, {"+/8=", "\xfb\xff"}, {"AAEC/f7/", std::string("\0\1\2\xfd\xfe\xff", 6)},
      {"AQI", {}},       // length not a multiple of four
      {"AQI=\n", {}},    {"Zm9v\r\n", {}}, {" AQI=", {}}, {"AQ I=", {}},  // no white space anywhere
      {"AQI-", {}},      {"AQI_", {}},     // the URL-safe alphabet is another encoding
      {"A===", {}},      {"=AAA", {}},     {"AQ=I", {}}, {"Zg=a", {}},  // padding only at the end
  };
  // clang-format on
  for (const auto& [text, plain] : rows) {
    std::optional<Data> decoded = platform::base64DecodeStrict(text);
    EXPECT_EQ(decoded ? std::optional<std::string>(decoded->view()) : std::nullopt, plain) << text;
    EXPECT_TRUE(!plain || platform::base64Encode(Data::fromString(*plain).span()) == text) << text;
  }
}

TEST(UUID, IsRandomVersionFourAndReadsAsItsBytesInUpperCase) {
  platform::UUID uuid;
  const std::string text = uuid.UUIDString();
  EXPECT_THAT(text, testing::MatchesRegex("[0-9A-F]{8}-[0-9A-F]{4}-4[0-9A-F]{3}-[89AB][0-9A-F]{3}-[0-9A-F]{12}"));
  std::string hex = text;
  std::erase(hex, '-');
  for (size_t i = 0; i < 16 && 2 * i < hex.size(); ++i)
    EXPECT_EQ(std::stoi(hex.substr(2 * i, 2), nullptr, 16), uuid.bytes()[i]) << text;
  EXPECT_NE(uuid, platform::UUID());
}

TEST(Locale, IdentifiersComeFromICUAndCompareExactly) {
  EXPECT_GT(platform::availableLocaleIdentifiers().size(), 100u);
  for (const char* id : {"en_US", "fr_FR", "zh_Hans_CN", "en"})
    EXPECT_TRUE(platform::isAvailableLocaleIdentifier(id)) << id;
  for (const char* id : {"en-US", "EN_US", "xx_YY", "", "en_US "})
    EXPECT_FALSE(platform::isAvailableLocaleIdentifier(id)) << id;
}

}  // namespace
