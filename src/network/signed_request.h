// The request side of every exchange with a device-services server: the JSON body, written once so
// that the bytes signed are the bytes uploaded, and the POST that carries it with the protocol's
// headers. The debug lines it writes are the same for the token operations and the handshake.
#pragma once

#include <optional>
#include <string>

#include "platform/http/http_message.h"
#include "platform/values/data.h"
#include "platform/values/value.h"

namespace signed_request {

// Seconds any exchange with the servers may take, the certificate download included.
inline constexpr double kRequestTimeout = 60.0;

// serializeBody logs `requestDict`, checks that JSON can hold it and writes it compactly. It returns
// the body, or nullopt after logging why it cannot be written (the caller fails as internal).
std::optional<platform::Data> serializeBody(const platform::Value& requestDict);

// logBody writes the debug lines of a body that serializeBody made from `requestDict`.
void logBody(const platform::Value& requestDict, const platform::Data& body);

// jsonPost returns a POST to `url` with the JSON content headers and "protocol-version", then the
// "session-identifier" and the base64 "signature" where given, and the 60-second time-out. The
// body is not attached: the upload task takes it.
platform::HTTPRequest jsonPost(std::string url, const std::optional<std::string>& sessionID,
                               const std::optional<platform::Data>& signature);

// logRequest writes the debug lines of `request` and its header fields.
void logRequest(const platform::HTTPRequest& request);

}  // namespace signed_request
