// The session's two network legs: the setup certificate from the static-content server and the
// handshake with the secure-association server, both over the process-wide shared HTTP session.
#include "network/zlka_network.h"
#include "platform/log/log.h"
#include "platform/values/base64.h"
#include "platform/values/json.h"

using platform::Data;
using platform::Error;
using platform::LogLevel;
using platform::Value;

namespace {

constexpr char kCertificateEndpoint[] = "deviceservices/setup.crt";
constexpr char kHandshakeEndpoint[] = "deviceservices/sapSession";
constexpr double kRequestTimeout = 60.0;

// Transport errors carry the failed task's user-info; the others carry none.
Error sessionError(int64_t code, std::optional<platform::Dictionary> userInfo = std::nullopt) {
  return Error(TarvexSAPSessionErrorDomain, code, std::move(userInfo));
}

void logRequest(const platform::HTTPRequest& request) {
  if (!platform::Log::enabled(LogLevel::Debug)) return;  // the header dictionary is made only to be written
  platform::log(LogLevel::Debug, "[#TokenAuth] request: %@", request);
  platform::log(LogLevel::Debug, "[#TokenAuth] request.allHTTPHeaderFields: %@", Value(request.allHTTPHeaderFields()));
}

// The checks both legs make of an answer: it arrived, with status 200 and a body. The error to
// hand the session otherwise. `showBody` adds the body to the debug lines.
std::optional<Error> checkAnswer(const std::optional<Data>& data, const std::optional<platform::HTTPResponse>& response,
                                 const std::optional<Error>& taskError, bool showBody) {
  if (taskError || !response) {
    platform::log(LogLevel::Fault, "[#TokenAuth] taskError: %@", taskError);
    return sessionError(TarvexSAPSessionErrorTransport, taskError ? taskError->userInfo() : std::nullopt);
  }
  platform::log(LogLevel::Debug, "[#TokenAuth] response: %@", *response);
  platform::log(LogLevel::Debug, "[#TokenAuth] responseData.length: %lu", data ? data->length() : 0);
  if (showBody && data && !data->empty())
    platform::log(LogLevel::Debug, "[#TokenAuth] responseData (string): %{private}@", data->view());
  if (response->statusCode != 200) {
    platform::log(LogLevel::Error, "[#TokenAuth] Server responded with invalid HTTP status code: %ld!",
                  response->statusCode);
    return sessionError(TarvexSAPSessionErrorBadResponse);
  }
  if (!data || data->empty()) {
    platform::log(LogLevel::Error, "[#TokenAuth] responseData is empty!");
    return sessionError(TarvexSAPSessionErrorBadResponse);
  }
  return std::nullopt;
}

}  // namespace

void ZLKANetwork::sessionRequestCertificateWithCompletionHandler(TarvexSAPSession&,
                                                                 TarvexSAPDataCompletion completion) {
  platform::log(LogLevel::Default, "[#TokenAuth] Requesting certificate for Tarvex SAP session...");
  if (!completion) return;
  std::string server = _selectedStaticContentServer();
  platform::log(LogLevel::Info, "[#TokenAuth] self._selectedStaticContentServer: %@", server);
  platform::HTTPRequest request(server + "/" + kCertificateEndpoint, 0, kRequestTimeout);
  request.HTTPMethod = "GET";
  logRequest(request);

  auto task = platform::HTTPSession::sharedSession()->dataTaskWithRequest(
      std::move(request), [completion](std::optional<Data> data, std::optional<platform::HTTPResponse> response,
                                       std::optional<Error> taskError) {
        if (auto error = checkAnswer(data, response, taskError, false))
          return completion(std::nullopt, std::move(error));
        completion(std::move(data), std::nullopt);
      });
  task->resume();
}

void ZLKANetwork::sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session,
                                                                     const std::optional<Data>& handshakeData,
                                                                     TarvexSAPDataCompletion completion) {
  platform::log(LogLevel::Default, "[#TokenAuth] Requesting handshake for Tarvex SAP session...");
  if (!completion) return;
  if (!handshakeData) {
    platform::log(LogLevel::Error, "[#TokenAuth] handshakeData = nil!");
    completion(std::nullopt, sessionError(TarvexSAPSessionErrorInvalidParameter));
    return;
  }
  std::string server = _selectedTarvexSAPServer();
  platform::log(LogLevel::Info, "[#TokenAuth] self._selectedTarvexSAPServer: %@", server);
  platform::HTTPRequest request(server + "/" + kHandshakeEndpoint, 0, kRequestTimeout);
  request.HTTPMethod = "POST";
  request.setValueForHTTPHeaderField("application/json", "Content-Type");
  request.setValueForHTTPHeaderField("application/json", "Accept");
  request.setValueForHTTPHeaderField("1.0", "protocol-version");
  logRequest(request);

  Value requestDict(platform::Dictionary{{"session-request", platform::base64Encode(handshakeData->span())},
                                         {"session-identifier", session.UUID().UUIDString()}});
  platform::log(LogLevel::Debug, "[#TokenAuth] requestDict: %{private}@", requestDict);
  if (!platform::json::isValidJSONObject(requestDict)) {
    platform::log(LogLevel::Error, "[#TokenAuth] isValidJSONObject (requestDict) = NO!");
    completion(std::nullopt, sessionError(TarvexSAPSessionErrorInternal));
    return;
  }
  std::string jsonError;
  std::optional<std::string> body = platform::json::serialize(requestDict, false, &jsonError);
  if (!body) {
    platform::log(LogLevel::Error, "[#TokenAuth] requestJSONError: %@", jsonError);
    completion(std::nullopt, sessionError(TarvexSAPSessionErrorInternal));
    return;
  }
  platform::log(LogLevel::Debug, "[#TokenAuth] requestData.length: %lu", body->size());
  platform::log(LogLevel::Debug, "[#TokenAuth] requestData (string): %{private}@", *body);

  std::weak_ptr<ZLKANetwork> weakSelf = weak_from_this();
  auto task = platform::HTTPSession::sharedSession()->uploadTaskWithRequest(
      std::move(request), Data::fromString(*body),
      [weakSelf, completion](std::optional<Data> data, std::optional<platform::HTTPResponse> response,
                             std::optional<Error> taskError) {
        if (auto error = checkAnswer(data, response, taskError, true))
          return completion(std::nullopt, std::move(error));
        std::string parseError;
        std::optional<Value> responseDict = platform::json::parse(data->view(), &parseError);
        if (!responseDict) {
          platform::log(LogLevel::Error, "[#TokenAuth] responseJSONError: %@", parseError);
          completion(std::nullopt, sessionError(TarvexSAPSessionErrorBadResponse));
          return;
        }
        platform::log(LogLevel::Debug, "[#TokenAuth] responseDict: %{private}@", responseDict);
        // A top-level array or scalar counts as missing members.
        const Value* info = responseDict->find("session-info");
        const Value* validity = responseDict->find("session-validity");
        if (!info || !info->string() || !validity || !validity->isNumber()) {
          platform::log(LogLevel::Error,
                        "[#TokenAuth] Invalid response dictionary received from server! (responseDict.count: %lu, "
                        "responseDict: %{private}@)",
                        responseDict->count(), responseDict);
          completion(std::nullopt, sessionError(TarvexSAPSessionErrorBadResponse));
          return;
        }
        std::optional<Data> sessionInfo = platform::base64DecodeStrict(*info->string());
        // The time-to-live is set before the session hears the answer, while it still waits.
        if (auto self = weakSelf.lock())
          if (auto sapSession = self->tarvexSAPSession()) sapSession->setTTL(*validity->numberValue());
        completion(std::move(sessionInfo), std::nullopt);
      });
  task->resume();
}
