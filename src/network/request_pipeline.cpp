#include "network/request_pipeline.h"

#include "network/answer_check.h"
#include "network/signed_request.h"
#include "network/token_array.h"
#include "platform/listener/connection.h"
#include "platform/log/log.h"
#include "platform/values/base64.h"
#include "support/base64_array.h"
#include "support/entitlements.h"
#include "support/errors.h"
#include "support/message_ids.h"

using platform::Data;
using platform::Error;
using platform::LogLevel;
using platform::Value;

namespace request_pipeline {

namespace {

// The stand-in signature when faults are injected into signing and verification.
const Data& forcedSignature() {
  static const Data bytes = Data::fromString("1234");
  return bytes;
}

// Only the code counts, whatever the domain: the session's transport and bad-answer failures keep
// their meaning, anything else is internal.
int64_t codeForSigningError(const std::optional<Error>& error) {
  if (error && error->code() == TarvexSAPSessionErrorTransport) return ZLKAErrorNetwork;
  if (error && error->code() == TarvexSAPSessionErrorBadResponse) return ZLKAErrorServer;
  return ZLKAErrorInternal;
}

int64_t codeForStatus(long status) {
  if (status == 400) return ZLKAErrorInvalidParameter;
  if (status == 401) return ZLKAErrorInternal;
  return ZLKAErrorServer;
}

}  // namespace

bool callerIsEntitled() {
  platform::Connection* connection = platform::Connection::currentConnection();
  return connection && Entitlements::hasCategory(*connection, ZLKAEntitlementCategoryTokenAuth, ZLKAEntitlement);
}

Error failure(int64_t code) {
  Error error = ZLKA_errorWithDomain(ZLKATokenManagerErrorDomain, code);
  platform::log(LogLevel::Fault, code == ZLKAErrorMissingEntitlement ? kMessageCallerRefused : kMessageOperationFailed,
                "[#TokenAuth] error: %@", error);
  return error;
}

std::optional<int64_t> sendSignedRequest(ZLKANetwork& network, const Data& token, const RequestPlan& plan,
                                         ResponseHandler handler) {
  // The connection is claimed first: a wait for one after signing could push the signed request
  // out of the server's replay window, and a call waiting here holds none of its request's memory.
  std::shared_ptr<platform::ConnectionClaim> claim = network.urlSession()->claimConnection();
  std::optional<std::vector<Data>> tokenArray = parseTokenArray(token);
  platform::log(LogLevel::Info, "[#TokenAuth] tokenArray.count: %lu", tokenArray ? tokenArray->size() : 0);
  if (platform::Log::enabled(LogLevel::Debug))
    platform::log(LogLevel::Debug, "[#TokenAuth] tokenArray: %{private}@",
                  tokenArray ? Value(platform::Array(tokenArray->begin(), tokenArray->end())) : Value());
  if (!tokenArray) return ZLKAErrorInvalidParameter;
  platform::Array encoded;
  for (std::string& s : base64EncodeArray(tokenArray)) encoded.emplace_back(std::move(s));
  if (platform::Log::enabled(LogLevel::Debug))
    platform::log(LogLevel::Debug, "[#TokenAuth] encodedTokenArray: %{private}@", Value(encoded));

  Value requestDict(plan.requestDict(std::move(encoded)));
  // The bytes signed are exactly the bytes uploaded.
  std::optional<Data> body = signed_request::serializeBody(requestDict);
  if (!body) return ZLKAErrorInternal;

  std::optional<Data> signature;
  if (network.forceTarvexSAPFailure()) {
    signature = forcedSignature();
  } else {
    bool timedOut = false;
    std::optional<Error> signingError;
    signature = network._tarvexSignatureForDataSync(*body, &timedOut, &signingError);
    if (timedOut) {
      platform::log(LogLevel::Error, "[#TokenAuth] Timed out waiting to generate Tarvex SAP signature!");
      return ZLKAErrorInternal;
    }
    if (!signature || signingError) {
      platform::log(LogLevel::Error, "[#TokenAuth] tarvexError: %@", signingError);
      return codeForSigningError(signingError);
    }
  }

  // Lines below their level are not written, so their arguments are not even made.
  if (platform::Log::enabled(LogLevel::Info))
    platform::log(LogLevel::Info, "[#TokenAuth] self._selectedAPIServer: %@", network._selectedAPIServer());
  std::string sessionID = network.tarvexSAPSession()->UUID().UUIDString();
  platform::HTTPRequest request = network._generateTokenAuthURLRequestForEndpoint(plan.endpoint, sessionID, signature);
  signed_request::logRequest(request);
  signed_request::logBody(requestDict, *body);

  network.urlSession()
      ->uploadTaskWithRequest(std::move(request), std::move(*body), std::move(handler), std::move(claim))
      ->resume();
  return std::nullopt;
}

std::optional<int64_t> checkAnswer(const std::optional<Error>& taskError,
                                   const std::optional<platform::HTTPResponse>& response,
                                   const std::optional<Data>& body, bool judgedByStatusAlone) {
  // A refused status is logged with the body: the server's error text says why.
  const answer_check::AnswerRules rules{.acceptNoContent = judgedByStatusAlone,
                                        .requireBody = !judgedByStatusAlone,
                                        .showBody = true,
                                        .statusLineShowsBody = true,
                                        .emptyBodyLevel = LogLevel::Default};
  std::optional<answer_check::AnswerFault> fault = answer_check::checkAnswer({body, response, taskError}, rules);
  if (!fault) return std::nullopt;
  if (*fault == answer_check::AnswerFault::Transport) return ZLKAErrorNetwork;
  if (*fault == answer_check::AnswerFault::Empty) return ZLKAErrorServer;
  return codeForStatus(response->statusCode);
}

std::variant<Value, int64_t> verifyAndParse(ZLKANetwork& network, const platform::HTTPResponse& response,
                                            const Data& body) {
  std::optional<Data> signature;
  if (std::optional<std::string> header = response.valueForHTTPHeaderField("signature"))
    signature = platform::base64DecodeStrict(*header);
  if (network.forceTarvexSAPFailure()) signature = forcedSignature();
  bool timedOut = false;
  std::optional<Error> verifyError;
  bool valid = network._verifyTarvexSignatureSync(signature, body, &timedOut, &verifyError);
  if (timedOut) {
    platform::log(LogLevel::Error, "[#TokenAuth] Timed out waiting to verify Tarvex SAP signature!");
    return ZLKAErrorInternal;
  }
  if (!valid) {
    platform::log(LogLevel::Error, "[#TokenAuth] tarvexError: %@", verifyError);
    return ZLKAErrorServer;
  }
  std::optional<Value> parsed = answer_check::parseAnswer(body);
  if (!parsed) return ZLKAErrorServer;
  return std::move(*parsed);
}

}  // namespace request_pipeline
