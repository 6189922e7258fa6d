#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <limits>

#include "platform/data.h"
#include "platform/error.h"
#include "platform/json.h"
#include "platform/value.h"

using platform::Array;
using platform::Data;
using platform::Dictionary;
using platform::Value;

TEST(Data, CopiesShareBytesAndCompareByContent) {
  const uint8_t raw[] = {1, 2, 3};
  Data a(raw, 3);
  Data b = a;
  EXPECT_EQ(a.bytes(), b.bytes());
  EXPECT_EQ(a, Data(std::vector<uint8_t>{1, 2, 3}));
  EXPECT_NE(a, Data(raw, 2));
  EXPECT_EQ(Data(), Data(raw, 0));
}

TEST(Data, AdoptsMallocBufferAndFreesItOnce) {
  auto* p = static_cast<uint8_t*>(std::malloc(4));
  std::memcpy(p, "abcd", 4);
  {
    Data d = Data::adoptMalloc(p, 4);
    Data copy = d;
    EXPECT_EQ(copy.view(), "abcd");
  }  // the sanitizer builds report a leak or a double free here if ownership is wrong
  EXPECT_TRUE(Data::adoptMalloc(nullptr, 0).empty());
}

TEST(Data, DescriptionShowsLengthAndBytes) {
  EXPECT_EQ(Data::fromString("\x01\xab").description(), "{length = 2, bytes = 0x01ab}");
  std::string big(100, '\x11');
  std::string d = Data::fromString(big).description();
  EXPECT_NE(d.find("length = 100"), std::string::npos);
  EXPECT_NE(d.find(" ... "), std::string::npos);
}

TEST(Value, BooleansAreNumbersButEqualOnlyToBooleans) {
  Value t(true);
  EXPECT_TRUE(t.isNumber());
  EXPECT_EQ(t.numberValue(), 1.0);
  EXPECT_TRUE(t.boolValue());
  EXPECT_FALSE(Value(0).boolValue());
  EXPECT_TRUE(Value(-2).boolValue());
  EXPECT_TRUE(Value(0.5).boolValue());
  EXPECT_FALSE(Value("YES").boolValue());
  EXPECT_NE(t, Value(1));
  EXPECT_EQ(Value(3), Value(3.0));
  EXPECT_EQ(Value(int64_t{5}), Value(uint64_t{5}));
  EXPECT_NE(Value(int64_t{-1}), Value(std::numeric_limits<uint64_t>::max()));
}

TEST(Value, ContainersCompareDeeplyAndLookUpMembers) {
  Value a(Dictionary{{"k", Array{1, "x", Value()}}});
  Value b(Dictionary{{"k", Array{1.0, "x", platform::Null{}}}});
  EXPECT_EQ(a, b);
  EXPECT_NE(a, Value(Dictionary{{"k", Array{1, "y", Value()}}}));
  ASSERT_NE(a.find("k"), nullptr);
  EXPECT_EQ(a.find("k")->count(), 3u);
  EXPECT_EQ(a.find("missing"), nullptr);
  EXPECT_EQ(Value("s").find("k"), nullptr);
  EXPECT_EQ(Value(Array{}).count(), 0u);
}

TEST(Value, DescriptionIsReadable) {
  Value v(Dictionary{{"a", Array{1, true, "q\"\n"}}, {"b", Data::fromString("\x0f")}, {"c", platform::Opaque{"fd"}}});
  EXPECT_EQ(v.description(), R"({"a": [1, true, "q\"\n"], "b": {length = 1, bytes = 0x0f}, "c": <fd>})");
}

TEST(Json, ValidityFollowsTheWriterRules) {
  using platform::json::isValidJSONObject;
  EXPECT_TRUE(isValidJSONObject(Value(Dictionary{{"a", Array{1, 2.5, "s", true, Value()}}})));
  EXPECT_TRUE(isValidJSONObject(Value(Array{})));
  EXPECT_FALSE(isValidJSONObject(Value("top-level string")));
  EXPECT_FALSE(isValidJSONObject(Value(1)));
  EXPECT_FALSE(isValidJSONObject(Value(Array{Data::fromString("x")})));
  EXPECT_FALSE(isValidJSONObject(Value(Array{std::nan("")})));
  EXPECT_FALSE(isValidJSONObject(Value(Dictionary{{"x", std::numeric_limits<double>::infinity()}})));
  EXPECT_FALSE(isValidJSONObject(Value(Array{platform::Opaque{"fd"}})));
}

TEST(Json, RoundTripKeepsTypes) {
  Value v(Dictionary{{"b", true}, {"i", -3}, {"u", std::numeric_limits<uint64_t>::max()}, {"d", 0.25}, {"n", Value()}, {"s", "é"}});
  auto text = platform::json::serialize(v);
  ASSERT_TRUE(text);
  EXPECT_EQ(text->find('\n'), std::string::npos);
  auto back = platform::json::parse(*text);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, v);
  EXPECT_TRUE(back->find("b")->isBool());
  EXPECT_TRUE(back->find("i")->integer());
  EXPECT_NE(platform::json::serialize(v, true)->find('\n'), std::string::npos);
}

TEST(Json, ParsingIsStrict) {
  std::string err;
  EXPECT_FALSE(platform::json::parse("\"fragment\"", &err));
  EXPECT_FALSE(err.empty());
  EXPECT_FALSE(platform::json::parse("3"));
  EXPECT_FALSE(platform::json::parse("{\"a\":1,}"));
  EXPECT_FALSE(platform::json::parse("{'a':1}"));
  EXPECT_FALSE(platform::json::parse(""));
  EXPECT_FALSE(platform::json::parse("{} trailing"));
  EXPECT_FALSE(platform::json::parse("[\"\xff\"]"));
  EXPECT_TRUE(platform::json::parse(" [1] "));
}

TEST(Json, RefusesHostileNestingWithoutCrashing) {
  std::string deep(100000, '[');
  deep += std::string(100000, ']');
  EXPECT_FALSE(platform::json::parse(deep));
  std::string ok(200, '[');
  ok += std::string(200, ']');
  EXPECT_TRUE(platform::json::parse(ok));
  // Brackets inside strings do not count as nesting.
  EXPECT_TRUE(platform::json::parse("[\"" + std::string(1000, '[') + "\"]"));
}

TEST(Error, UserInfoAbsentIsDistinctFromEmpty) {
  platform::Error none("D", -7);
  platform::Error empty("D", -7, Dictionary{});
  EXPECT_FALSE(none.userInfo().has_value());
  EXPECT_TRUE(empty.userInfo().has_value());
  EXPECT_NE(none, empty);
  EXPECT_EQ(none.localizedDescription(), "The operation couldn't be completed. (D error -7.)");
  platform::Error withText("D", -2, Dictionary{{platform::LocalizedDescriptionKey, "msg"}});
  EXPECT_EQ(withText.localizedDescription(), "msg");
  EXPECT_EQ(withText.description(), R"(Error Domain=D Code=-2 "msg" UserInfo={"LocalizedDescription": "msg"})");
}
