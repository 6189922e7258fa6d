// Token activation: "deviceservices/activateAccessory", answered with a replacement token.
#include "network/request_pipeline.h"
#include "platform/log/log.h"
#include "support/base64_array.h"
#include "support/errors.h"

using platform::Data;
using platform::LogLevel;
using platform::Value;

namespace {

// The replacement token arrives as two base64 pieces; it is their plain concatenation. A piece
// that does not decode is dropped without a word, as the pieces' decoder does everywhere.
void replyWithNewToken(const Value& answer, const std::function<void(int64_t)>& fail,
                       const ZLKAActivationReply& reply) {
  const Value* tokens = answer.find("tokens");
  if (!tokens || !tokens->array()) {
    platform::log(LogLevel::Error,
                  "[#TokenAuth] Invalid response dictionary received from server! (responseDict.count: %lu, "
                  "responseDict: %{private}@)",
                  answer.count(), answer);
    return fail(ZLKAErrorServer);
  }
  const platform::Array& pieces = *tokens->array();
  bool allStrings = std::all_of(pieces.begin(), pieces.end(), [](const Value& v) { return v.isString(); });
  if (pieces.size() != 2 || !allStrings) {
    platform::log(
        LogLevel::Error,
        "[#TokenAuth] Invalid token array received from server - newTokenArray: %{private}@, newTokenArray.count: %lu!",
        *tokens, pieces.size());
    return fail(ZLKAErrorServer);
  }
  platform::log(LogLevel::Debug, "[#TokenAuth] newTokenArray: %{private}@", *tokens);
  std::vector<std::string> strings;
  for (const Value& v : pieces) strings.push_back(*v.string());
  std::vector<Data> decoded = base64DecodeArray(strings);
  if (platform::Log::enabled(LogLevel::Debug))  // the array copies every piece
    platform::log(LogLevel::Debug, "[#TokenAuth] decodedNewTokenArray: %{private}@",
                  Value(platform::Array(decoded.begin(), decoded.end())));
  std::vector<uint8_t> newToken;
  for (const Data& piece : decoded) newToken.insert(newToken.end(), piece.bytes(), piece.bytes() + piece.length());
  Data result(std::move(newToken));
  platform::log(LogLevel::Debug, "[#TokenAuth] newToken.length: %lu, newToken: %{private}@", result.length(), result);
  reply(std::move(result), std::nullopt);
}

}  // namespace

void ZLKANetwork::requestActivationForToken(const std::optional<Data>& token, const std::optional<std::string>& uuid,
                                            ZLKAActivationReply reply) {
  platform::log(LogLevel::Default,
                "[#TokenAuth] Requesting activation for token: %{private}@ (token.length: %lu, uuid: %{private}@)",
                token, token ? token->length() : 0, uuid);
  std::function<void(int64_t)> fail = [reply](int64_t code) { reply(std::nullopt, request_pipeline::failure(code)); };

  if (!request_pipeline::callerIsEntitled()) return fail(ZLKAErrorMissingEntitlement);
  if (!token || !uuid) return fail(ZLKAErrorInvalidParameter);
  if (forceNetworkFailure()) {
    platform::log(LogLevel::Default, "[#TokenAuth] Forcing network failure...");
    return fail(ZLKAErrorNetwork);
  }
  if (forceTokenActivationFailure()) {
    platform::log(LogLevel::Default, "[#TokenAuth] Forcing token activation failure...");
    return fail(ZLKAErrorNetwork);
  }

  request_pipeline::RequestPlan plan{"deviceservices/activateAccessory", [&](platform::Array tokens) {
                                       return platform::Dictionary{{"tokens", std::move(tokens)}, {"uuid", *uuid}};
                                     }};
  auto self = shared_from_this();
  auto handler = [self, fail, reply](std::optional<Data> body, std::optional<platform::HTTPResponse> response,
                                     std::optional<platform::Error> taskError) {
    if (auto code = request_pipeline::checkAnswer(taskError, response, body, false)) return fail(*code);
    auto parsed = request_pipeline::verifyAndParse(*self, *response, *body);
    if (auto code = std::get_if<int64_t>(&parsed)) return fail(*code);
    replyWithNewToken(std::get<Value>(parsed), fail, reply);
  };
  if (auto code = request_pipeline::sendSignedRequest(*this, *token, plan, std::move(handler))) fail(*code);
}
