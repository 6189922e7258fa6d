#include "support/errors.h"

#include <gtest/gtest.h>

namespace {

constexpr char kUnknown[] = "An unknown error has occurred.";

TEST(Errors, ManagerDomainsKnowTheirSixCodesAndOtherDomainsOnlyTheUnknownMessage) {
  struct Row {
    const char* domain;
    int64_t code;
    std::optional<std::string> description;
  };
  const char* token = ZLKATokenManagerErrorDomain;
  const char* certificate = ZLKACertificateManagerErrorDomain;
  // clang-format off
  const Row rows[] = {
      {token, -1, kUnknown}, {token, -2, "Framework client is missing entitlement."},
      {token, -3, "An invalid parameter was provided by the caller."}, {token, -4, "An internal error has occurred."},
      {token, -5, "There was a problem connecting to the network."}, {token, -6, "An internal server error has occurred."},
      {certificate, -2, "Framework client is missing entitlement."}, {certificate, -6, "An internal server error has occurred."},
      {token, 0, std::nullopt}, {token, -7, std::nullopt}, {certificate, 1, std::nullopt}, {token, INT64_MIN, std::nullopt},
      {ZLKAErrorDomain, -5, kUnknown}, {ZLKAErrorDomain, 42, kUnknown}, {"SomethingElse", -2, kUnknown},
      {"zlkatokenmanagererrordomain", -2, kUnknown},  // domains compare exactly
  };
  // clang-format on
  for (const Row& r : rows) {
    EXPECT_EQ(errorDescription(r.domain, r.code), r.description) << r.domain << " " << r.code;
    // The constructor carries the message, or no user-info at all when there is none.
    platform::Error e = ZLKA_errorWithDomain(r.domain, r.code);
    EXPECT_EQ(e.domain(), r.domain);
    EXPECT_EQ(e.code(), r.code);
    std::optional<platform::Dictionary> expected;
    if (r.description) expected = platform::Dictionary{{platform::LocalizedDescriptionKey, *r.description}};
    EXPECT_EQ(e.userInfo(), expected) << r.domain << " " << r.code;
  }
  EXPECT_EQ(ZLKA_errorWithDomain("D", -3, std::nullopt).userInfo(), std::nullopt);
  EXPECT_EQ(ZLKA_errorWithDomain("D", -3, std::string()).userInfo(),
            (platform::Dictionary{{platform::LocalizedDescriptionKey, ""}}));
}

}  // namespace
