#include <gtest/gtest.h>

#include "support/errors.h"

using platform::LocalizedDescriptionKey;

namespace {
std::optional<std::string> messageOf(const platform::Error& e) {
  if (!e.userInfo()) return std::nullopt;
  auto it = e.userInfo()->find(LocalizedDescriptionKey);
  return it == e.userInfo()->end() ? std::nullopt : std::optional<std::string>(*it->second.string());
}
}  // namespace

TEST(ErrorDescription, ManagerDomainsShareTheirMessagesAndKnowOnlyTheirCodes) {
  for (const char* domain : {ZLKATokenManagerErrorDomain, ZLKACertificateManagerErrorDomain}) {
    EXPECT_EQ(errorDescription(domain, -1), "An unknown error has occurred.");
    EXPECT_EQ(errorDescription(domain, -2), "Framework client is missing entitlement.");
    EXPECT_EQ(errorDescription(domain, -3), "An invalid parameter was provided by the caller.");
    EXPECT_EQ(errorDescription(domain, -4), "An internal error has occurred.");
    EXPECT_EQ(errorDescription(domain, -5), "There was a problem connecting to the network.");
    EXPECT_EQ(errorDescription(domain, -6), "An internal server error has occurred.");
    for (int64_t code : std::initializer_list<int64_t>{0, 1, -7, INT64_MIN, INT64_MAX}) EXPECT_EQ(errorDescription(domain, code), std::nullopt) << code;
  }
}

TEST(ErrorDescription, OtherDomainsAlwaysGetTheUnknownMessage) {
  for (int64_t code : {-5, 0, 42}) {
    EXPECT_EQ(errorDescription(ZLKAErrorDomain, code), "An unknown error has occurred.");
    EXPECT_EQ(errorDescription("SomethingElse", code), "An unknown error has occurred.");
  }
  // Domain names are compared exactly.
  EXPECT_EQ(errorDescription("zlkatokenmanagererrordomain", -2), "An unknown error has occurred.");
}

TEST(ErrorConstructors, CarryTheMessageOrNoUserInfoAtAll) {
  platform::Error entitlement = ZLKA_errorWithDomain(ZLKATokenManagerErrorDomain, -2);
  EXPECT_EQ(entitlement.domain(), ZLKATokenManagerErrorDomain);
  EXPECT_EQ(entitlement.code(), -2);
  EXPECT_EQ(messageOf(entitlement), "Framework client is missing entitlement.");
  EXPECT_EQ(entitlement.userInfo()->size(), 1u);

  EXPECT_FALSE(ZLKA_errorWithDomain(ZLKATokenManagerErrorDomain, 0).userInfo().has_value());
  EXPECT_FALSE(ZLKA_errorWithDomain(ZLKATokenManagerErrorDomain, -7).userInfo().has_value());
  EXPECT_EQ(messageOf(ZLKA_errorWithDomain(ZLKAErrorDomain, -5)), "An unknown error has occurred.");
  EXPECT_EQ(messageOf(ZLKA_errorWithDomain(ZLKACertificateManagerErrorDomain, -6)), "An internal server error has occurred.");

  EXPECT_FALSE(ZLKA_errorWithDomain("D", -3, std::nullopt).userInfo().has_value());
  EXPECT_EQ(messageOf(ZLKA_errorWithDomain("D", -3, std::string("custom"))), "custom");
  EXPECT_EQ(messageOf(ZLKA_errorWithDomain("D", -3, std::string())), "");
}
