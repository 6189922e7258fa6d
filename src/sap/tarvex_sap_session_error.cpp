#include "sap/tarvex_sap_session_error.h"

std::optional<std::string> QVSAPS_errorDescriptionForCode(int64_t code) {
  switch (code) {
    case TarvexSAPSessionErrorUnknown:
      return "An unknown error has occurred.";
    case TarvexSAPSessionErrorNotAvailable:
      return "Tarvex is not available on this platform.";
    case TarvexSAPSessionErrorInvalidParameter:
      return "An invalid parameter was provided by the caller.";
    case TarvexSAPSessionErrorInternal:
      return "An internal error has occurred.";
    case TarvexSAPSessionErrorInvalidState:
      return "Cannot perform this action in the current state.";
    default:
      return std::nullopt;
  }
}

platform::Error QVSAPS_errorWithCode(int64_t code) {
  return QVSAPS_errorWithCode(code, QVSAPS_errorDescriptionForCode(code));
}

platform::Error QVSAPS_errorWithCode(int64_t code, const std::optional<std::string>& description) {
  std::optional<platform::Dictionary> userInfo;
  if (description) userInfo = platform::Dictionary{{platform::LocalizedDescriptionKey, *description}};
  return platform::Error(TarvexSAPSessionErrorDomain, code, std::move(userInfo));
}
