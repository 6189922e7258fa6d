// The one home of the gate's value rules: which entitlement values admit a caller. The daemon's
// tests keep only one admitted and one refused caller.
#include "support/entitlements.h"

#include <gtest/gtest.h>

using platform::Array;
using platform::Dictionary;
using platform::Value;

namespace {

constexpr char kKey[] = "com.kestro.ZLKAuthentication";

platform::Connection peerWith(std::optional<Value> value) {
  return platform::Connection("peer", [value](std::string_view key) { return key == kKey ? value : std::nullopt; });
}

struct Row {
  std::optional<Value> value;  // nullopt: the peer does not hold the entitlement
  bool admitted;
};

TEST(Entitlements, AnEntitlementIsHeldByATrueNumberOrAnyContainer) {
  // clang-format off
  const Row rows[] = {
      {std::nullopt, false}, {true, true}, {false, false}, {1, true}, {-1, true}, {0, false}, {0.5, true}, {0.0, false},
      {uint64_t{0}, false}, {Array{}, true}, {Dictionary{}, true},
      {"true", false}, {"token-auth", false}, {Value(), false}, {platform::Data::fromString("\x01"), false},
  };
  // clang-format on
  for (const Row& r : rows)
    EXPECT_EQ(Entitlements::hasEntitlement(peerWith(r.value), kKey), r.admitted)
        << (r.value ? r.value->description() : "absent");
}

TEST(Entitlements, ACategoryIsGrantedByAnArrayHoldingItOrATrueNumberUnderItInADictionary) {
  // clang-format off
  const Row rows[] = {
      {Array{"token-auth"}, true}, {Array{"x", "token-auth"}, true}, {Array{"other"}, false}, {Array{}, false},
      {Array{"TOKEN-AUTH"}, false}, {Array{"token-auth "}, false},  // names compare exactly
      {Array{Array{"token-auth"}}, false}, {Array{Dictionary{{"token-auth", true}}}, false},  // not searched deeper
      {Dictionary{{"token-auth", true}}, true}, {Dictionary{{"token-auth", 2}}, true}, {Dictionary{{"token-auth", false}}, false},
      {Dictionary{{"token-auth", 0.0}}, false}, {Dictionary{{"token-auth", "yes"}}, false},  // a number, not text
      {Dictionary{{"token-auth", Value()}}, false}, {Dictionary{{"token-auth", Array{}}}, false},
      {Dictionary{{"other", true}}, false}, {true, false}, {"token-auth", false}, {std::nullopt, false},
  };
  // clang-format on
  for (const Row& r : rows) {
    EXPECT_EQ(Entitlements::hasCategory(peerWith(r.value), "token-auth", kKey), r.admitted)
        << (r.value ? r.value->description() : "absent");
  }
  EXPECT_FALSE(Entitlements::hasCategory(peerWith(Value(Array{"token-auth"})), "token-auth", "another.entitlement"));
}

}  // namespace
