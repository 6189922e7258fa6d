// What a finished transfer hands its completion, and the errors of transfers that produced no
// answer.
#include "platform/http/http_transfer.h"

namespace platform {

Error transportError(CURLcode code, const std::string& detail, const std::string& url) {
  int64_t errorCode = HTTPErrorUnknown;
  std::string text;
  switch (code) {
    case CURLE_OPERATION_TIMEDOUT:
      errorCode = HTTPErrorTimedOut;
      text = "The request timed out.";
      break;
    case CURLE_COULDNT_CONNECT:
    case CURLE_COULDNT_RESOLVE_HOST:
    case CURLE_COULDNT_RESOLVE_PROXY:
      errorCode = HTTPErrorCannotConnectToHost;
      text = "Could not connect to the server.";
      break;
    case CURLE_URL_MALFORMAT:
    case CURLE_UNSUPPORTED_PROTOCOL:
      errorCode = HTTPErrorBadURL;
      text = "unsupported URL";
      break;
    case CURLE_GOT_NOTHING:
    case CURLE_RECV_ERROR:
    case CURLE_SEND_ERROR:
    case CURLE_SEND_FAIL_REWIND:
    case CURLE_PARTIAL_FILE:
      errorCode = HTTPErrorNetworkConnectionLost;
      text = "The network connection was lost.";
      break;
    case CURLE_WRITE_ERROR:
      errorCode = HTTPErrorResourceTooLarge;
      text = "The answer exceeds the maximum size.";
      break;
    case CURLE_PEER_FAILED_VERIFICATION:
    case CURLE_SSL_CONNECT_ERROR:
    case CURLE_SSL_CERTPROBLEM:
    case CURLE_SSL_CACERT_BADFILE:
    case CURLE_SSL_CIPHER:
      errorCode = HTTPErrorSecureConnectionFailed;
      text = "A TLS error occurred and a secure connection to the server cannot be made.";
      break;
    default:
      text = curl_easy_strerror(code);
      break;
  }
  if (!detail.empty()) text += " (" + detail + ")";
  return Error(
      HTTPErrorDomain, errorCode,
      Dictionary{{LocalizedDescriptionKey, text}, {"FailingURL", url}, {"TransportCode", static_cast<int64_t>(code)}});
}

Error cancelledError(const std::string& url) {
  return Error(HTTPErrorDomain, HTTPErrorCancelled,
               Dictionary{{LocalizedDescriptionKey, "cancelled"}, {"FailingURL", url}});
}

HTTPOutcome transferOutcome(HTTPTaskState& t, CURLcode result) {
  HTTPOutcome outcome;
  if (result != CURLE_OK) {
    outcome.error = transportError(result, t.errorBuffer, t.request.URL);
    return outcome;
  }
  HTTPResponse r;
  curl_easy_getinfo(t.easy.get(), CURLINFO_RESPONSE_CODE, &r.statusCode);
  char* effective = nullptr;
  curl_easy_getinfo(t.easy.get(), CURLINFO_EFFECTIVE_URL, &effective);
  r.URL = effective ? effective : t.request.URL;
  r.headerFields = std::move(t.responseHeaders);
  outcome.response = std::move(r);
  outcome.body = Data(std::move(t.received));
  return outcome;
}

}  // namespace platform
