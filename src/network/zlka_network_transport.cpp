// The session's two network legs: the setup certificate from the static-content server and the
// handshake with the secure-association server, both over the process-wide shared HTTP session.
#include "network/answer_check.h"
#include "network/signed_request.h"
#include "network/zlka_network.h"
#include "platform/log/log.h"
#include "platform/values/base64.h"

using platform::Data;
using platform::Error;
using platform::LogLevel;
using platform::Value;

namespace {

constexpr char kCertificateEndpoint[] = "deviceservices/setup.crt";
constexpr char kHandshakeEndpoint[] = "deviceservices/sapSession";

// The certificate is not text worth showing; the handshake's answer is.
constexpr answer_check::AnswerRules kCertificateAnswer{.showBody = false};
constexpr answer_check::AnswerRules kHandshakeAnswer{};

// Transport errors carry the failed task's user-info; the others carry none.
Error sessionError(int64_t code, std::optional<platform::Dictionary> userInfo = std::nullopt) {
  return Error(TarvexSAPSessionErrorDomain, code, std::move(userInfo));
}

// The error to hand the session when an answer did not pass, else nullopt.
std::optional<Error> checkAnswer(const std::optional<Data>& data, const std::optional<platform::HTTPResponse>& response,
                                 const std::optional<Error>& taskError, const answer_check::AnswerRules& rules) {
  std::optional<answer_check::AnswerFault> fault = answer_check::checkAnswer({data, response, taskError}, rules);
  if (!fault) return std::nullopt;
  if (*fault == answer_check::AnswerFault::Transport)
    return sessionError(TarvexSAPSessionErrorTransport, taskError ? taskError->userInfo() : std::nullopt);
  return sessionError(TarvexSAPSessionErrorBadResponse);
}

}  // namespace

void ZLKANetwork::sessionRequestCertificateWithCompletionHandler(TarvexSAPSession&,
                                                                 TarvexSAPDataCompletion completion) {
  platform::log(LogLevel::Default, "[#TokenAuth] Requesting certificate for Tarvex SAP session...");
  if (!completion) return;
  std::string server = _selectedStaticContentServer();
  platform::log(LogLevel::Info, "[#TokenAuth] self._selectedStaticContentServer: %@", server);
  platform::HTTPRequest request(server + "/" + kCertificateEndpoint, 0, signed_request::kRequestTimeout);
  request.HTTPMethod = "GET";
  signed_request::logRequest(request);

  auto task = platform::HTTPSession::sharedSession()->dataTaskWithRequest(
      std::move(request), [completion](std::optional<Data> data, std::optional<platform::HTTPResponse> response,
                                       std::optional<Error> taskError) {
        if (auto error = checkAnswer(data, response, taskError, kCertificateAnswer))
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
  // The handshake is what makes signing possible: it goes out unsigned.
  platform::HTTPRequest request =
      signed_request::jsonPost(server + "/" + kHandshakeEndpoint, std::nullopt, std::nullopt);
  signed_request::logRequest(request);

  Value requestDict(platform::Dictionary{{"session-request", platform::base64Encode(handshakeData->span())},
                                         {"session-identifier", session.UUID().UUIDString()}});
  std::optional<Data> body = signed_request::serializeBody(requestDict);
  if (!body) {
    completion(std::nullopt, sessionError(TarvexSAPSessionErrorInternal));
    return;
  }

  std::weak_ptr<ZLKANetwork> weakSelf = weak_from_this();
  auto task = platform::HTTPSession::sharedSession()->uploadTaskWithRequest(
      std::move(request), std::move(*body),
      [weakSelf, completion](std::optional<Data> data, std::optional<platform::HTTPResponse> response,
                             std::optional<Error> taskError) {
        if (auto error = checkAnswer(data, response, taskError, kHandshakeAnswer))
          return completion(std::nullopt, std::move(error));
        std::optional<Value> responseDict = answer_check::parseAnswer(*data);
        if (!responseDict) {
          completion(std::nullopt, sessionError(TarvexSAPSessionErrorBadResponse));
          return;
        }
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
