// The service's error domains, codes and messages, and the constructors every failure goes through.
//
// In the two manager domains a code from -6 to -1 has its fixed message and any other code none;
// any other domain always gets the generic "unknown" message.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/values/error.h"

inline constexpr char ZLKAErrorDomain[] = "ZLKAuthenticationErrorDomain";
inline constexpr char ZLKACertificateManagerErrorDomain[] = "ZLKACertificateManagerErrorDomain";
inline constexpr char ZLKATokenManagerErrorDomain[] = "ZLKATokenManagerErrorDomain";

enum ZLKAErrorCode : int64_t {
  ZLKAErrorUnknown = -1,
  ZLKAErrorMissingEntitlement = -2,
  ZLKAErrorInvalidParameter = -3,
  ZLKAErrorInternal = -4,
  ZLKAErrorNetwork = -5,
  ZLKAErrorServer = -6,
};

// errorDescription is the fixed message of `code` in `domain` (above), or nullopt when it has none.
std::optional<std::string> errorDescription(std::string_view domain, int64_t code);

// An error whose description is errorDescription(domain, code).
platform::Error ZLKA_errorWithDomain(const std::string& domain, int64_t code);
// A description of nullopt gives an error with no user-info at all.
platform::Error ZLKA_errorWithDomain(const std::string& domain, int64_t code,
                                     const std::optional<std::string>& description);
