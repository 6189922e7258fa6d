// The session's error values: domain, code, and the user-info that carries a description.
#include <gtest/gtest.h>

#include "sap/tarvex_sap_session_error.h"
#include "sap_test_support.h"

namespace saptest {
namespace {

TEST(SessionErrorTest, CodesWithADescriptionCarryIt) {
  const std::pair<int64_t, const char*> described[] = {
      {-1, "An unknown error has occurred."},
      {-2, "Tarvex is not available on this platform."},
      {-3, "An invalid parameter was provided by the caller."},
      {-4, "An internal error has occurred."},
      {-7, "Cannot perform this action in the current state."},
  };
  for (const auto& [code, text] : described) {
    SCOPED_TRACE(code);
    EXPECT_EQ(QVSAPS_errorDescriptionForCode(code), std::optional<std::string>(text));
    expectSessionError(QVSAPS_errorWithCode(code), code, std::string(text));
  }
}

TEST(SessionErrorTest, CodesWithoutADescriptionCarryNoUserInfo) {
  for (int64_t code : {-5, -6, -8, 0, 1, -100}) {
    SCOPED_TRACE(code);
    EXPECT_FALSE(QVSAPS_errorDescriptionForCode(code).has_value());
    expectSessionError(QVSAPS_errorWithCode(code), code, std::nullopt);
  }
}

TEST(SessionErrorTest, AnExplicitDescriptionReplacesTheFixedOne) {
  expectSessionError(QVSAPS_errorWithCode(-7, std::string("Session must be open to verify signature.")), -7,
                     std::string("Session must be open to verify signature."));
  expectSessionError(QVSAPS_errorWithCode(-3, std::nullopt), -3, std::nullopt);
  expectSessionError(QVSAPS_errorWithCode(-6, std::string("custom")), -6, std::string("custom"));
}

}  // namespace
}  // namespace saptest
