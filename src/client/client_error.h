// Errors as the client reports them.
//
// An operation's own failure (a D-Bus error named com.kestro.ZLKAuthentication.Error.<Name>) comes
// back as the daemon made it: domain "ZLKATokenManagerErrorDomain", the code of <Name> (-1 Unknown,
// -2 MissingEntitlement, -3 InvalidParameter, -4 Internal, -5 Network, -6 Server) and the D-Bus
// message as its localized description. Everything else (the bus cannot be reached, the service is
// absent or silent, the bus or the service refuses the call, the answer is malformed, arguments
// that cannot be encoded) is an error of kClientErrorDomain with a ClientErrorCode; errors that
// came as D-Bus errors carry the D-Bus name and message in their user info.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/values/error.h"
#include "zlka/client.h"

namespace zlka_client {

// One definition with the public header, which states them to applications.
using zlka::ClientErrorCode;
using zlka::kClientErrorDomain;
using zlka::kOperationErrorDomain;

// User-info keys of client errors made from a D-Bus error.
inline constexpr char kBusErrorNameKey[] = "DBusErrorName";
inline constexpr char kBusErrorMessageKey[] = "DBusErrorMessage";

// clientError makes the kClientErrorDomain error of `code` with `description` as its message.
platform::Error clientError(ClientErrorCode code, std::string description);

// The error for a D-Bus error reply (name and message as received).
platform::Error errorFromBusError(std::string_view name, std::string_view message);

// The error for a negative errno from sd-bus while sending a call (no D-Bus error name).
platform::Error errorFromSendFailure(int negativeErrno);

// True for errors that mean the service could not be reached at all (ConnectionFailed and
// ServiceUnavailable), as opposed to a call that reached it and failed.
bool isServiceUnreachable(const platform::Error& error);

}  // namespace zlka_client
