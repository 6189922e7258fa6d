#include <gtest/gtest.h>

#include "support/entitlements.h"

using platform::Array;
using platform::Connection;
using platform::Dictionary;
using platform::Value;

namespace {
Connection peerWith(std::optional<Value> value) {
  return Connection("peer", [value](std::string_view key) -> std::optional<Value> {
    if (key == "com.kestro.ZLKAuthentication") return value;
    return std::nullopt;
  });
}
constexpr char kKey[] = "com.kestro.ZLKAuthentication";
}  // namespace

TEST(Entitlements, CategoryIsGrantedByAnArrayHoldingItOrATrueDictionaryEntry) {
  struct Case {
    std::optional<Value> value;
    bool granted;
  };
  const Case cases[] = {
      {Value(Array{"token-auth"}), true},
      {Value(Array{"x", "token-auth"}), true},
      {Value(Array{"other"}), false},
      {Value(Array{}), false},
      {Value(Array{Array{"token-auth"}}), false},
      {Value(true), false},
      {Value("token-auth"), false},
      {std::nullopt, false},
      {Value(Dictionary{{"token-auth", true}}), true},
      {Value(Dictionary{{"token-auth", 2}}), true},
      {Value(Dictionary{{"token-auth", false}}), false},
      {Value(Dictionary{{"token-auth", 0.0}}), false},
      {Value(Dictionary{{"token-auth", "yes"}}), false},
      {Value(Dictionary{{"token-auth", Value()}}), false},
      {Value(Dictionary{{"other", true}}), false},
  };
  for (const Case& c : cases) {
    Connection peer = peerWith(c.value);
    EXPECT_EQ(Entitlements::hasCategory(peer, "token-auth", kKey), c.granted) << (c.value ? c.value->description() : "absent");
  }
  EXPECT_FALSE(Entitlements::hasCategory(peerWith(Value(Array{"token-auth"})), "token-auth", "another.entitlement"));
}

TEST(Entitlements, AnEntitlementIsHeldByTrueNumbersAndAnyContainer) {
  struct Case {
    std::optional<Value> value;
    bool held;
  };
  const Case cases[] = {
      {std::nullopt, false},        {Value(true), true},         {Value(1), true},
      {Value(false), false},        {Value(0), false},           {Value(Array{}), true},
      {Value(Dictionary{}), true},  {Value("token-auth"), false}, {Value(), false},
  };
  for (const Case& c : cases)
    EXPECT_EQ(Entitlements::hasEntitlement(peerWith(c.value), kKey), c.held) << (c.value ? c.value->description() : "absent");
}
