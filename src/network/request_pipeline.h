// The signed request pipeline shared by the three token operations: the entitlement gate, the
// request side (token array, body, signature, signed HTTP request, upload) and the checks of the
// answer (transport, status, signature, JSON). Failures come back as service error codes.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <variant>

#include "network/zlka_network.h"
#include "platform/http/http_message.h"
#include "platform/values/data.h"
#include "platform/values/error.h"
#include "platform/values/value.h"

namespace request_pipeline {

using ResponseHandler =
    std::function<void(std::optional<platform::Data> body, std::optional<platform::HTTPResponse> response,
                       std::optional<platform::Error> taskError)>;

struct RequestPlan {
  const char* endpoint;
  // Builds the request dictionary from the base64 token strings.
  std::function<platform::Dictionary(platform::Array encodedTokens)> requestDict;
};

// callerIsEntitled is true when the connection of the message being served holds "token-auth" in
// the service's entitlement; false with no current connection. Read on the delivering thread,
// before any hop.
bool callerIsEntitled();

// failure returns the ZLKATokenManagerErrorDomain error of `code` handed to a client, after one
// fault-level log line (with the caller-refused or operation-failed MESSAGE_ID).
platform::Error failure(int64_t code);

// sendSignedRequest parses `token`, builds the body by `plan`, signs it, and uploads it. It returns
// nullopt once the request is on its way (`handler` will run once, on the HTTP session's callback
// queue), else the code to fail with: -3 for token data that does not parse, -5 or -6 when the
// session's open failed in transport or on a bad answer, and -4 for any other failure to sign.
std::optional<int64_t> sendSignedRequest(ZLKANetwork& network, const platform::Data& token, const RequestPlan& plan,
                                         ResponseHandler handler);

// checkAnswer returns nullopt when the answer may go on, else the code to fail with: -5 for a
// transport error, -3 for status 400, -4 for 401, -6 for another status or a missing body. An
// answer judged by its status alone also passes with 204 and needs no body.
std::optional<int64_t> checkAnswer(const std::optional<platform::Error>& taskError,
                                   const std::optional<platform::HTTPResponse>& response,
                                   const std::optional<platform::Data>& body, bool judgedByStatusAlone);

// verifyAndParse returns the JSON answer of a body that checkAnswer passed once its "signature"
// header verifies over it, else -6 for a bad signature or JSON that does not parse, and -4 when
// the verification ran out of time.
std::variant<platform::Value, int64_t> verifyAndParse(ZLKANetwork& network, const platform::HTTPResponse& response,
                                                      const platform::Data& body);

}  // namespace request_pipeline
