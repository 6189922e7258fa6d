#include "client/client_error.h"

#include <cerrno>
#include <cstring>

#include "client/bus_names.h"

namespace zlka_client {

namespace {

// Bus errors that mean no one answered, as opposed to a refusal by whoever did.
bool meansUnreachable(std::string_view name) {
  static constexpr std::string_view names[] = {
      "org.freedesktop.DBus.Error.ServiceUnknown", "org.freedesktop.DBus.Error.NameHasNoOwner",
      "org.freedesktop.DBus.Error.NoReply",        "org.freedesktop.DBus.Error.Timeout",
      "org.freedesktop.DBus.Error.TimedOut",       "org.freedesktop.DBus.Error.Disconnected",
      "org.freedesktop.DBus.Error.NoServer",       "org.freedesktop.DBus.Error.NoNetwork",
  };
  for (std::string_view known : names)
    if (name == known) return true;
  return name.starts_with("org.freedesktop.DBus.Error.Spawn.");  // bus activation failed
}

int64_t operationCode(std::string_view name) {
  static constexpr std::string_view names[] = {
      "Unknown", "MissingEntitlement", "InvalidParameter", "Internal", "Network", "Server"};
  for (int64_t i = 0; i < 6; ++i)
    if (name == names[i]) return -(i + 1);
  return 0;
}

}  // namespace

platform::Error clientError(ClientErrorCode code, std::string description) {
  return platform::Error(kClientErrorDomain, static_cast<int64_t>(code),
                         platform::Dictionary{{platform::LocalizedDescriptionKey, std::move(description)}});
}

platform::Error errorFromBusError(std::string_view name, std::string_view message) {
  std::string_view prefix = kOperationErrorPrefix;
  if (name.starts_with(prefix)) {
    if (int64_t code = operationCode(name.substr(prefix.size()))) {
      // Exactly the daemon's error: no user info is added, so that the two compare equal.
      if (message.empty()) return platform::Error(kOperationErrorDomain, code);
      return platform::Error(kOperationErrorDomain, code,
                             platform::Dictionary{{platform::LocalizedDescriptionKey, std::string(message)}});
    }
  }
  bool unreachable = meansUnreachable(name);
  std::string detail = std::string(name) + (message.empty() ? "" : ": " + std::string(message));
  std::string description = unreachable
                                ? "The service " + std::string(kServiceName) + " cannot be reached (" + detail + ")."
                                : "The call was refused with " + detail;
  return platform::Error(
      kClientErrorDomain,
      static_cast<int64_t>(unreachable ? ClientErrorCode::ServiceUnavailable : ClientErrorCode::Refused),
      platform::Dictionary{{platform::LocalizedDescriptionKey, std::move(description)},
                           {kBusErrorNameKey, std::string(name)},
                           {kBusErrorMessageKey, std::string(message)}});
}

platform::Error errorFromSendFailure(int negativeErrno) {
  int e = -negativeErrno;
  std::string reason = std::strerror(e);
  switch (e) {
    case EINVAL:
    case EBADMSG:
    case E2BIG:
    case EMSGSIZE:
      return clientError(ClientErrorCode::InvalidRequest, "The call could not be encoded: " + reason + ".");
    default:
      return clientError(ClientErrorCode::ServiceUnavailable, "The call could not be sent: " + reason + ".");
  }
}

bool isServiceUnreachable(const platform::Error& error) {
  return error.domain() == kClientErrorDomain &&
         (error.code() == static_cast<int64_t>(ClientErrorCode::ConnectionFailed) ||
          error.code() == static_cast<int64_t>(ClientErrorCode::ServiceUnavailable));
}

}  // namespace zlka_client
