// One HTTP task as the session's engine runs it: its state, the set-up of its libcurl transfer,
// the rule for sending it once more, and what its completion hands the caller. Private to the
// http facility.
#pragma once

#include <curl/curl.h>

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch/semaphore.h"
#include "platform/http/curl_handles.h"
#include "platform/http/http_session.h"

namespace platform {

class ConnectionClaim {
 public:
  // ConnectionClaim holds one of the claims already taken from `claims` and gives it back, with a
  // signal, when destroyed.
  explicit ConnectionClaim(std::shared_ptr<Semaphore> claims) : claims_(std::move(claims)) {}
  ConnectionClaim(const ConnectionClaim&) = delete;
  ConnectionClaim& operator=(const ConnectionClaim&) = delete;
  ~ConnectionClaim() { claims_->signal(); }

 private:
  std::shared_ptr<Semaphore> claims_;
};

struct HTTPTaskState {
  HTTPRequest request;
  std::optional<Data> body;
  HTTPCompletion completion;
  std::shared_ptr<ConnectionClaim> claim;  // given back when the task completes
  std::weak_ptr<HTTPSession::Engine> engine;
  std::atomic<bool> started{false};
  std::atomic<bool> finished{false};

  // Owned by the engine's thread while the transfer runs.
  CurlEasyPtr easy;
  CurlSlistPtr headers;
  size_t uploaded = 0;  // body bytes handed to libcurl so far
  bool resent = false;  // the request went out a second time, on a fresh connection
  std::vector<uint8_t> received;
  HTTPHeaderFields responseHeaders;
  char errorBuffer[CURL_ERROR_SIZE] = {};
  size_t maximumResponseSize = 0;
};

// What a task's completion is called with: (body, response, nullopt) when an answer arrived,
// (nullopt, nullopt, error) when none did.
struct HTTPOutcome {
  std::optional<Data> body;
  std::optional<HTTPResponse> response;
  std::optional<Error> error;

  // failure is the outcome of a task that got no answer.
  static HTTPOutcome failure(Error error) { return {std::nullopt, std::nullopt, std::move(error)}; }
};

// configureTransfer sets every option of the task's transfer on `t.easy` (a fresh or reset handle)
// for `configuration` and a time-out capped at `capMs` (0: none). It returns false, with the
// handle left to its owner, when libcurl cannot store the request's headers.
bool configureTransfer(HTTPTaskState& t, const HTTPSessionConfiguration& configuration, int64_t capMs);

// shouldResend tells whether a transfer that ended with `result` may go out once more on a fresh
// connection: only when it was sent on a reused connection that the server had already closed,
// before any byte of an answer arrived, and never twice.
bool shouldResend(const HTTPTaskState& t, CURLcode result);

// rewindForResend is libcurl's seek callback for an upload (`user` is the task): it allows the one
// rewind to the start that a resend needs, and refuses any other.
int rewindForResend(void* user, curl_off_t offset, int origin);

// transferOutcome reads what the finished transfer produced; it moves the body and headers out of
// `t`, which keeps its handle.
HTTPOutcome transferOutcome(HTTPTaskState& t, CURLcode result);

// transportError is the HTTPErrorDomain error for a transfer that failed with `code`; `detail`
// (libcurl's message, may be empty) is added to the description.
Error transportError(CURLcode code, const std::string& detail, const std::string& url);
// cancelledError is the error of a task cancelled before it completed.
Error cancelledError(const std::string& url);

}  // namespace platform
