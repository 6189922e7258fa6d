// HTTPSession: HTTPS requests over one libcurl multi handle and one worker thread per session.
//
// Tasks are made suspended and start with resume(); each calls its completion exactly once, on the
// session's serial callback queue, with (body, response, nullopt) when an answer arrived (whatever
// its status) or (nullopt, nullopt, error) when none did. TLS verification is always on, with the
// configured CA file ([tls] ca_file) or the system store; only https is spoken; redirects are not
// followed. Connections are reused within a session; a request whose body has gone out is never
// sent again, even when the reused connection dies before the answer (the task fails instead).
// The ephemeral session keeps no cookies, cache or credentials; the shared session is the
// process-wide one.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/data.h"
#include "platform/error.h"
#include "platform/http_message.h"
#include "platform/queue.h"

namespace platform {

inline constexpr char HTTPErrorDomain[] = "HTTPErrorDomain";
enum HTTPErrorCode : int64_t {
  HTTPErrorUnknown = -1,
  HTTPErrorCancelled = -999,
  HTTPErrorBadURL = -1000,
  HTTPErrorTimedOut = -1001,
  HTTPErrorCannotConnectToHost = -1004,
  HTTPErrorNetworkConnectionLost = -1005,
  HTTPErrorResourceTooLarge = -1103,
  HTTPErrorSecureConnectionFailed = -1200,
};

using HTTPCompletion = std::function<void(std::optional<Data> body, std::optional<HTTPResponse> response,
                                          std::optional<Error> error)>;

struct HTTPSessionConfiguration {
  std::string caFile;                         // extra CA bundle; empty: the system store
  size_t maximumResponseSize = 16u << 20;     // larger answers fail with HTTPErrorResourceTooLarge
  std::string label = "HTTPSession";          // names the callback queue

  // Both take the CA file of the current configuration.
  static HTTPSessionConfiguration defaultSessionConfiguration();
  static HTTPSessionConfiguration ephemeralSessionConfiguration();
};

class HTTPSession;
struct HTTPTaskState;

class HTTPTask {
 public:
  void resume();
  void cancel();  // completes with HTTPErrorCancelled unless already complete
  const HTTPRequest& originalRequest() const;

 private:
  friend class HTTPSession;
  explicit HTTPTask(std::shared_ptr<HTTPTaskState> state) : state_(std::move(state)) {}
  std::shared_ptr<HTTPTaskState> state_;
};

class HTTPSession {
 public:
  static std::shared_ptr<HTTPSession> sessionWithConfiguration(HTTPSessionConfiguration configuration);
  static std::shared_ptr<HTTPSession> sharedSession();
  ~HTTPSession();

  std::shared_ptr<HTTPTask> uploadTaskWithRequest(HTTPRequest request, Data body, HTTPCompletion completion);
  std::shared_ptr<HTTPTask> dataTaskWithRequest(HTTPRequest request, HTTPCompletion completion);

  // Cancels every task (each completes with HTTPErrorCancelled) and refuses new ones.
  void invalidateAndCancel();
  const std::shared_ptr<Queue>& callbackQueue() const;

  // Caps the time-out of every request made from now on (tests); nullopt removes the cap.
  static void setMaximumTimeout(std::optional<std::chrono::milliseconds> cap);

  class Engine;

 private:
  explicit HTTPSession(HTTPSessionConfiguration configuration);
  std::shared_ptr<Engine> engine_;
};

}  // namespace platform
