// The product-plan metadata query: "deviceservices/queryProductPlan".
#include "network/request_pipeline.h"
#include "platform/log/log.h"
#include "support/errors.h"

using platform::Data;
using platform::LogLevel;
using platform::Value;

void ZLKANetwork::requestMetadataForToken(const std::optional<Data>& token, const std::optional<std::string>& uuid,
                                          const std::optional<platform::Locale>& requestedLocale,
                                          const std::optional<platform::Dictionary>& requestInfo,
                                          ZLKAMetadataReply reply) {
  std::optional<std::string> localeIdentifier;
  if (requestedLocale) localeIdentifier = requestedLocale->localeIdentifier();
  platform::log(LogLevel::Default,
                "[#TokenAuth] Requesting PPID metadata for token: %{private}@ (token.length: %lu, uuid: %{private}@, "
                "requestedLocale: %@)",
                token, token ? token->length() : 0, uuid, localeIdentifier);
  auto fail = [reply](int64_t code) {
    reply(std::nullopt, std::nullopt, std::nullopt, request_pipeline::failure(code));
  };

  if (!request_pipeline::callerIsEntitled()) return fail(ZLKAErrorMissingEntitlement);
  if (!token || !uuid || !requestedLocale) return fail(ZLKAErrorInvalidParameter);
  // Checked before the forced network failure, so an unknown locale is always reported as such.
  if (!platform::isAvailableLocaleIdentifier(*localeIdentifier)) {
    platform::log(LogLevel::Default, "[#TokenAuth] Invalid locale identifier: %@", localeIdentifier);
    return fail(ZLKAErrorInvalidParameter);
  }
  if (forceNetworkFailure()) {
    platform::log(LogLevel::Default, "[#TokenAuth] Forcing network failure...");
    return fail(ZLKAErrorNetwork);
  }

  request_pipeline::RequestPlan plan{
      "deviceservices/queryProductPlan", [&](platform::Array tokens) {
        platform::Dictionary dict{{"tokens", std::move(tokens)}, {"uuid", *uuid}, {"locale", *localeIdentifier}};
        if (requestInfo) dict.emplace("request_info", *requestInfo);
        return dict;
      }};
  auto self = shared_from_this();
  auto handler = [self, fail, reply](std::optional<Data> body, std::optional<platform::HTTPResponse> response,
                                     std::optional<platform::Error> taskError) {
    if (auto code = request_pipeline::checkAnswer(taskError, response, body, false)) return fail(*code);
    auto parsed = request_pipeline::verifyAndParse(*self, *response, *body);
    if (auto code = std::get_if<int64_t>(&parsed)) return fail(*code);
    const Value& answer = std::get<Value>(parsed);

    const Value* ppid = answer.find("ppid");
    const Value* locale = answer.find("locale");
    const Value* metadata = answer.find("ppid_metadata");
    // The reply declares a string and a dictionary: anything else is as bad as a missing key.
    if (!ppid || !locale || !metadata || !ppid->string() || !metadata->dictionary()) {
      platform::log(LogLevel::Error, "[#TokenAuth] Invalid JSON response received from server! %{private}@", answer);
      return fail(ZLKAErrorServer);
    }
    if (!locale->string() || !platform::isAvailableLocaleIdentifier(*locale->string())) {
      // The identifier as text, not as a quoted JSON value; anything else as the value it is.
      platform::log(LogLevel::Error, "[#TokenAuth] Invalid locale received from server: '%@'",
                    locale->string() ? *locale->string() : locale->description());
      return fail(ZLKAErrorServer);
    }
    reply(*ppid->string(), platform::Locale(*locale->string()), *metadata->dictionary(), std::nullopt);
  };
  if (auto code = request_pipeline::sendSignedRequest(*this, *token, plan, std::move(handler))) fail(*code);
}
