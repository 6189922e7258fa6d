#include "network/request_pipeline.h"

#include "network/token_array.h"
#include "platform/bus/connection.h"
#include "platform/log/log.h"
#include "platform/values/base64.h"
#include "platform/values/json.h"
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
  platform::log(LogLevel::Debug, "[#TokenAuth] requestDict: %{private}@", requestDict);
  if (!platform::json::isValidJSONObject(requestDict)) {
    platform::log(LogLevel::Error, "[#TokenAuth] isValidJSONObject (requestDict) = NO!");
    return ZLKAErrorInternal;
  }
  std::string jsonError;
  std::optional<std::string> text = platform::json::serialize(requestDict, false, &jsonError);
  if (!text) {
    platform::log(LogLevel::Error, "[#TokenAuth] requestJSONError: %@", jsonError);
    return ZLKAErrorInternal;
  }
  // The bytes signed are exactly the bytes uploaded.
  Data body = Data::fromString(*text);
  platform::log(LogLevel::Debug, "[#TokenAuth] requestData.length: %lu", body.length());
  platform::log(LogLevel::Debug, "[#TokenAuth] requestData (string): %{private}@", *text);

  std::optional<Data> signature;
  if (network.forceTarvexSAPFailure()) {
    signature = forcedSignature();
  } else {
    bool timedOut = false;
    std::optional<Error> signingError;
    signature = network._tarvexSignatureForDataSync(body, &timedOut, &signingError);
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
  platform::log(LogLevel::Debug, "[#TokenAuth] request: %@", request);
  if (platform::Log::enabled(LogLevel::Debug))
    platform::log(LogLevel::Debug, "[#TokenAuth] request.allHTTPHeaderFields: %@",
                  Value(request.allHTTPHeaderFields()));
  platform::log(LogLevel::Debug, "[#TokenAuth] requestDict: %{private}@", requestDict);
  platform::log(LogLevel::Debug, "[#TokenAuth] requestData.length: %lu", body.length());
  platform::log(LogLevel::Debug, "[#TokenAuth] requestData (string): %{private}@", *text);

  network.urlSession()
      ->uploadTaskWithRequest(std::move(request), std::move(body), std::move(handler), std::move(claim))
      ->resume();
  return std::nullopt;
}

std::optional<int64_t> checkTransportAndStatus(const std::optional<Error>& taskError,
                                               const std::optional<platform::HTTPResponse>& response,
                                               const std::optional<Data>& body, bool acceptNoContent) {
  if (taskError || !response) {
    platform::log(LogLevel::Fault, "[#TokenAuth] taskError: %@", taskError);
    return ZLKAErrorNetwork;
  }
  platform::log(LogLevel::Debug, "[#TokenAuth] response: %@", *response);
  platform::log(LogLevel::Debug, "[#TokenAuth] responseData.length: %lu", body ? body->length() : 0);
  if (body && !body->empty())
    platform::log(LogLevel::Debug, "[#TokenAuth] responseData (string): %{private}@", body->view());
  long status = response->statusCode;
  if (status == 200 || (acceptNoContent && status == 204)) return std::nullopt;
  platform::log(LogLevel::Error,
                "[#TokenAuth] Server responded with invalid HTTP status code: %ld!\nresponseData (string): %@", status,
                body ? std::string(body->view()) : std::string());
  if (status == 400) return ZLKAErrorInvalidParameter;
  if (status == 401) return ZLKAErrorInternal;
  return ZLKAErrorServer;
}

std::variant<Value, int64_t> verifyAndParse(ZLKANetwork& network, const platform::HTTPResponse& response,
                                            const std::optional<Data>& body) {
  if (!body || body->empty()) {
    platform::log(LogLevel::Default, "[#TokenAuth] responseData is empty!");
    return ZLKAErrorServer;
  }
  std::optional<Data> signature;
  if (std::optional<std::string> header = response.valueForHTTPHeaderField("signature"))
    signature = platform::base64DecodeStrict(*header);
  if (network.forceTarvexSAPFailure()) signature = forcedSignature();
  bool timedOut = false;
  std::optional<Error> verifyError;
  bool valid = network._verifyTarvexSignatureSync(signature, *body, &timedOut, &verifyError);
  if (timedOut) {
    platform::log(LogLevel::Error, "[#TokenAuth] Timed out waiting to verify Tarvex SAP signature!");
    return ZLKAErrorInternal;
  }
  if (!valid) {
    platform::log(LogLevel::Error, "[#TokenAuth] tarvexError: %@", verifyError);
    return ZLKAErrorServer;
  }
  std::string parseError;
  std::optional<Value> parsed = platform::json::parse(body->view(), &parseError);
  if (!parsed) {
    platform::log(LogLevel::Error, "[#TokenAuth] responseJSONError: %@", parseError);
    return ZLKAErrorServer;
  }
  platform::log(LogLevel::Debug, "[#TokenAuth] responseDict: %{private}@", parsed);
  return std::move(*parsed);
}

}  // namespace request_pipeline
