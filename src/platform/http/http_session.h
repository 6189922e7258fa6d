// HTTPSession: HTTPS requests over one libcurl multi handle and one event thread per session.
//
// Tasks are made suspended and start with resume(); each calls its completion exactly once, on the
// session's serial callback queue, with (body, response, nullopt) when an answer arrived (whatever
// its status) or (nullopt, nullopt, error) when none did. TLS verification is always on, with the
// configured CA file ([tls] ca_file) or the system store; only https is spoken; redirects are not
// followed. Connections are reused within a session, up to `maximumConnectionsPerHost` to one
// server, and dropped after a few idle seconds. A request that went out on a reused connection
// which the server had already closed is sent once more on a fresh one, but only when no byte of an
// answer arrived: the server never saw it.
// The ephemeral session keeps no cookies, cache or credentials; the shared session is the
// process-wide one.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/dispatch/queue.h"
#include "platform/http/http_message.h"
#include "platform/values/data.h"
#include "platform/values/error.h"

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

using HTTPCompletion =
    std::function<void(std::optional<Data> body, std::optional<HTTPResponse> response, std::optional<Error> error)>;

struct HTTPSessionConfiguration {
  std::string caFile;                      // extra CA bundle; empty: the system store
  size_t maximumResponseSize = 16u << 20;  // larger answers fail with HTTPErrorResourceTooLarge
  std::string label = "HTTPSession";       // names the callback queue
  long maximumConnectionsPerHost = 32;     // further requests to that server wait for one

  // Both take the CA file of the current configuration.
  static HTTPSessionConfiguration defaultSessionConfiguration();
  static HTTPSessionConfiguration ephemeralSessionConfiguration();
};

class HTTPSession;
struct HTTPTaskState;

// A claim on one of a session's connections: see HTTPSession::claimConnection.
class ConnectionClaim;

class HTTPTask {
 public:
  // resume starts the task once (later calls do nothing); a session that is gone or cannot start
  // its event thread completes it with an error instead.
  void resume();
  // cancel completes the task with HTTPErrorCancelled unless it has already completed.
  void cancel();
  // originalRequest is the request the task was made with, owned by the task.
  const HTTPRequest& originalRequest() const;

 private:
  friend class HTTPSession;
  explicit HTTPTask(std::shared_ptr<HTTPTaskState> state) : state_(std::move(state)) {}
  std::shared_ptr<HTTPTaskState> state_;
};

class HTTPSession {
 public:
  // sessionWithConfiguration makes a session of its own; it never fails (its thread starts later
  // if none can be had now).
  static std::shared_ptr<HTTPSession> sessionWithConfiguration(HTTPSessionConfiguration configuration);
  // sharedSession is the process-wide session, made on first use with the default configuration.
  static std::shared_ptr<HTTPSession> sharedSession();
  // The destructor cancels every task still running, as invalidateAndCancel does.
  ~HTTPSession();

  // A suspended task that sends `body`; with a claim, the task holds it until it completes.
  std::shared_ptr<HTTPTask> uploadTaskWithRequest(HTTPRequest request, Data body, HTTPCompletion completion,
                                                  std::shared_ptr<ConnectionClaim> claim = nullptr);
  // A suspended task that sends the request without a body.
  std::shared_ptr<HTTPTask> dataTaskWithRequest(HTTPRequest request, HTTPCompletion completion);

  // Waits, as blocking work, until fewer than `maximumConnectionsPerHost` claims of this session
  // are held, and returns one; it is given back when the last reference goes. A request that is
  // signed after its claim is taken never waits for a connection afterwards, so the wait cannot
  // push it out of a server's replay window. Never fails; the claim may outlive the session.
  std::shared_ptr<ConnectionClaim> claimConnection();

  // Cancels every task (each completes with HTTPErrorCancelled) and refuses new ones.
  void invalidateAndCancel();
  // callbackQueue is the serial queue that every completion of this session runs on.
  const std::shared_ptr<Queue>& callbackQueue() const;

  // Caps the time-out of every request made from now on (tests); nullopt removes the cap.
  static void setMaximumTimeout(std::optional<std::chrono::milliseconds> cap);

  class Engine;

 private:
  explicit HTTPSession(HTTPSessionConfiguration configuration);
  std::shared_ptr<Engine> engine_;
};

}  // namespace platform
