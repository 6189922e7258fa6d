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

// Whether the connection of the message being served holds "token-auth" in the service's
// entitlement. Read on the delivering thread, before any hop.
bool callerIsEntitled();

// The error handed to a client, logged at fault level first.
platform::Error failure(int64_t code);

// Token array, body, signature, request, upload. nullopt once the request is on its way (the handler
// will run on the HTTP session's callback queue), else the code to fail with.
std::optional<int64_t> sendSignedRequest(ZLKANetwork& network, const platform::Data& token, const RequestPlan& plan,
                                         ResponseHandler handler);

// Transport error, status and empty body: nullopt when the answer may go on, else the code to fail
// with. An answer judged by its status alone also passes with 204 and needs no body.
std::optional<int64_t> checkAnswer(const std::optional<platform::Error>& taskError,
                                   const std::optional<platform::HTTPResponse>& response,
                                   const std::optional<platform::Data>& body, bool judgedByStatusAlone);

// Signature and JSON of a body that checkAnswer passed: the parsed answer or the code to fail with.
std::variant<platform::Value, int64_t> verifyAndParse(ZLKANetwork& network, const platform::HTTPResponse& response,
                                                      const platform::Data& body);

}  // namespace request_pipeline
