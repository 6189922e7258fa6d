// What a running DevServer holds, shared by the file that sets it up and runs it (dev_server.cpp)
// and the one that answers its requests (request_dispatch.cpp). Private to the server.
#pragma once

#include <httplib.h>

#include <chrono>
#include <condition_variable>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "devserver/catalog.h"
#include "devserver/connection_tracker.h"
#include "devserver/dev_server.h"
#include "devserver/device_services.h"
#include "devserver/fault_table.h"
#include "devserver/server_stats.h"
#include "devserver/state_dir.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace devserver {

// What the request log needs from the hooks that cpp-httplib calls around one request
// (pre-routing, handler, logger: all on the connection's worker thread).
struct RequestContext {
  std::optional<std::chrono::steady_clock::time_point> start;
  bool dropped = false;
};
extern thread_local RequestContext tlRequest;

inline bool isAdminPath(const std::string& path) { return path.starts_with("/_admin/"); }

// setAnswer puts `answer` (status, body unless the status has none, content type) into `res`.
void setAnswer(httplib::Response& res, const Answer& answer);

struct DevServer::Impl {
  explicit Impl(DevServerOptions opts) : options(std::move(opts)) {}

  DevServerOptions options;
  DevServerState state;
  std::optional<Catalog> catalog;
  std::unique_ptr<TarvexSAPServer> sap;
  std::unique_ptr<DeviceServices> services;
  FaultTable faults;
  ServerStats stats;
  ConnectionTracker tracker{[this] { stats.countConnection(); }};  // outlives `http`
  std::unique_ptr<httplib::SSLServer> http;
  std::thread listener;
  std::promise<void> running;
  std::once_flag runningOnce;
  uint16_t port = 0;
  socket_t listeningSocket = INVALID_SOCKET;
  bool started = false;

  std::mutex stopMutex;
  std::condition_variable stopWake;
  bool stopping = false;  // guarded by stopMutex

  void markRunning() {
    std::call_once(runningOnce, [this] { running.set_value(); });
  }
  bool configureTLS(SSL_CTX& ctx);
  void configureHTTP();
  void dispatch(const httplib::Request& req, httplib::Response& res);
  void dispatchDevice(const httplib::Request& req, httplib::Response& res);
  void dispatchAdmin(const httplib::Request& req, httplib::Response& res);
  void respond(Endpoint endpoint, const httplib::Request& req, httplib::Response& res, Answer answer);
  void signAnswer(const Answer& answer, SignatureFault mode, httplib::Response& res);
  bool pause(std::chrono::milliseconds delay);
  void log(const httplib::Request& req, const httplib::Response& res);
};

}  // namespace devserver
