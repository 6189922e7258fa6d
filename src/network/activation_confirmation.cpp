// Activation confirmation: "deviceservices/ackAccessory". The answer is judged by its status alone;
// its signature is not verified and its body not read.
#include "network/request_pipeline.h"
#include "platform/log/log.h"
#include "support/errors.h"

using platform::Data;
using platform::LogLevel;

void ZLKANetwork::confirmActivationForToken(const std::optional<Data>& token, const std::optional<std::string>& uuid,
                                            ZLKAConfirmationReply reply) {
  platform::log(LogLevel::Default,
                "[#TokenAuth] Confirming activation for token: %{private}@ (token.length: %lu, uuid: %{private}@)",
                token, token ? token->length() : 0, uuid);
  auto fail = [reply](int64_t code) { reply(request_pipeline::failure(code)); };

  if (!request_pipeline::callerIsEntitled()) return fail(ZLKAErrorMissingEntitlement);
  if (!token || !uuid) return fail(ZLKAErrorInvalidParameter);
  if (forceNetworkFailure()) {
    platform::log(LogLevel::Default, "[#TokenAuth] Forcing network failure...");
    return fail(ZLKAErrorNetwork);
  }
  if (forceTokenConfirmationFailure()) {
    platform::log(LogLevel::Default, "[#TokenAuth] Forcing token confirmation failure...");
    return fail(ZLKAErrorNetwork);
  }

  request_pipeline::RequestPlan plan{"deviceservices/ackAccessory", [&](platform::Array tokens) {
                                       return platform::Dictionary{{"tokens", std::move(tokens)}, {"uuid", *uuid}};
                                     }};
  auto handler = [fail, reply](std::optional<Data> body, std::optional<platform::HTTPResponse> response,
                               std::optional<platform::Error> taskError) {
    if (auto code = request_pipeline::checkAnswer(taskError, response, body, true)) return fail(*code);
    reply(std::nullopt);
  };
  if (auto code = request_pipeline::sendSignedRequest(*this, *token, plan, std::move(handler))) fail(*code);
}
