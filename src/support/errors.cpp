#include "support/errors.h"

std::optional<std::string> errorDescription(std::string_view domain, int64_t code) {
  if (domain != ZLKACertificateManagerErrorDomain && domain != ZLKATokenManagerErrorDomain)
    return "An unknown error has occurred.";
  switch (code) {
    case ZLKAErrorUnknown:
      return "An unknown error has occurred.";
    case ZLKAErrorMissingEntitlement:
      return "Framework client is missing entitlement.";
    case ZLKAErrorInvalidParameter:
      return "An invalid parameter was provided by the caller.";
    case ZLKAErrorInternal:
      return "An internal error has occurred.";
    case ZLKAErrorNetwork:
      return "There was a problem connecting to the network.";
    case ZLKAErrorServer:
      return "An internal server error has occurred.";
    default:
      return std::nullopt;
  }
}

platform::Error ZLKA_errorWithDomain(const std::string& domain, int64_t code) {
  return ZLKA_errorWithDomain(domain, code, errorDescription(domain, code));
}

platform::Error ZLKA_errorWithDomain(const std::string& domain, int64_t code,
                                     const std::optional<std::string>& description) {
  std::optional<platform::Dictionary> userInfo;
  if (description) userInfo = platform::Dictionary{{platform::LocalizedDescriptionKey, *description}};
  return platform::Error(domain, code, std::move(userInfo));
}
