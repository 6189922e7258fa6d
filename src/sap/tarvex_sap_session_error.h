// Errors of the secure-association session, in their own domain. The token operations map them
// onto the service's codes; clients never see them.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/values/error.h"

inline constexpr char TarvexSAPSessionErrorDomain[] = "TarvexSAPSessionErrorDomain";

enum TarvexSAPSessionErrorCode : int64_t {
  TarvexSAPSessionErrorUnknown = -1,
  TarvexSAPSessionErrorNotAvailable = -2,
  TarvexSAPSessionErrorInvalidParameter = -3,
  TarvexSAPSessionErrorInternal = -4,
  TarvexSAPSessionErrorTransport = -5,    // no description of its own
  TarvexSAPSessionErrorBadResponse = -6,  // no description of its own
  TarvexSAPSessionErrorInvalidState = -7,
};

// The code's fixed description; nullopt for -5, -6 and codes outside -7..-1.
std::optional<std::string> QVSAPS_errorDescriptionForCode(int64_t code);

// QVSAPS_errorWithCode makes the session-domain error of `code` with its fixed description.
platform::Error QVSAPS_errorWithCode(int64_t code);
// QVSAPS_errorWithCode makes it with `description` instead; nullopt means no user-info at all.
platform::Error QVSAPS_errorWithCode(int64_t code, const std::optional<std::string>& description);
