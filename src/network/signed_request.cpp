#include "network/signed_request.h"

#include "platform/log/log.h"
#include "platform/values/base64.h"
#include "platform/values/json.h"

using platform::Data;
using platform::LogLevel;
using platform::Value;

namespace signed_request {

namespace {

void logBodyText(const Data& body) {
  platform::log(LogLevel::Debug, "[#TokenAuth] requestData.length: %lu", body.length());
  platform::log(LogLevel::Debug, "[#TokenAuth] requestData (string): %{private}@", body.view());
}

}  // namespace

std::optional<Data> serializeBody(const Value& requestDict) {
  platform::log(LogLevel::Debug, "[#TokenAuth] requestDict: %{private}@", requestDict);
  if (!platform::json::isValidJSONObject(requestDict)) {
    platform::log(LogLevel::Error, "[#TokenAuth] isValidJSONObject (requestDict) = NO!");
    return std::nullopt;
  }
  platform::Result<std::string> text = platform::json::serialize(requestDict);
  if (!text) {
    platform::log(LogLevel::Error, "[#TokenAuth] requestJSONError: %@", text.error());
    return std::nullopt;
  }
  Data body = Data::fromString(*text);
  logBodyText(body);
  return body;
}

void logBody(const Value& requestDict, const Data& body) {
  platform::log(LogLevel::Debug, "[#TokenAuth] requestDict: %{private}@", requestDict);
  logBodyText(body);
}

platform::HTTPRequest jsonPost(std::string url, const std::optional<std::string>& sessionID,
                               const std::optional<Data>& signature) {
  platform::HTTPRequest request(std::move(url), 0, kRequestTimeout);
  request.HTTPMethod = "POST";
  request.setValueForHTTPHeaderField("application/json", "Content-Type");
  request.setValueForHTTPHeaderField("application/json", "Accept");
  request.setValueForHTTPHeaderField("1.0", "protocol-version");
  if (sessionID) request.setValueForHTTPHeaderField(*sessionID, "session-identifier");
  if (signature) request.setValueForHTTPHeaderField(platform::base64Encode(signature->span()), "signature");
  return request;
}

void logRequest(const platform::HTTPRequest& request) {
  if (!platform::Log::enabled(LogLevel::Debug)) return;  // the header dictionary is made only to be written
  platform::log(LogLevel::Debug, "[#TokenAuth] request: %@", request);
  platform::log(LogLevel::Debug, "[#TokenAuth] request.allHTTPHeaderFields: %@", Value(request.allHTTPHeaderFields()));
}

}  // namespace signed_request
