#include "devserver/dev_server.h"

#include <httplib.h>
#include <openssl/rand.h>

#include <condition_variable>
#include <cstdio>
#include <future>
#include <mutex>
#include <nlohmann/json.hpp>
#include <thread>
#include <utility>

#include "devserver/catalog.h"
#include "devserver/connection_tracker.h"
#include "devserver/device_services.h"
#include "devserver/fault_table.h"
#include "devserver/listen_address.h"
#include "devserver/server_stats.h"
#include "devserver/state_dir.h"
#include "devserver/strict_base64.h"
#include "devserver/worker_pool.h"
#include "tarvexsap/tarvex_sap_server.h"

namespace devserver {

using nlohmann::json;

namespace {

constexpr std::size_t kMaxBody = 1024 * 1024;
constexpr std::size_t kInitialWorkers = 4;
constexpr std::size_t kMaxWorkers = 256;
constexpr std::size_t kKeepAliveRequests = 1000000;

// What the request log needs from the hooks that cpp-httplib calls around one request
// (pre-routing, handler, logger: all on the connection's worker thread).
struct RequestContext {
  std::optional<std::chrono::steady_clock::time_point> start;
  bool dropped = false;
};
thread_local RequestContext tlRequest;

bool isAdminPath(const std::string& path) { return path.starts_with("/_admin/"); }

const char* errorReason(int status) {
  switch (status) {
    case 400:
      return "bad request";
    case 404:
      return "no such endpoint";
    case 405:
      return "method not allowed";
    case 413:
      return "body larger than 1 MiB";
    case 414:
      return "request URI too long";
    case 500:
      return "internal error";
    default:
      return "request failed";
  }
}

std::optional<std::string> header(const httplib::Request& req, const char* name) {
  if (!req.has_header(name)) {
    return std::nullopt;
  }
  return req.get_header_value(name);
}

void setAnswer(httplib::Response& res, const Answer& answer) {
  res.status = answer.status;
  if (answer.status == 204 || answer.status == 304) {
    return;  // these carry no body on the wire
  }
  res.set_content(answer.body, answer.contentType);  // also when empty: the error handler keeps out
}

void setJSON(httplib::Response& res, int status, const json& value) {
  res.status = status;
  res.set_content(value.dump(-1, ' ', false, json::error_handler_t::replace), "application/json");
}

// Paths come from the network: keep the log one line per request.
std::string printable(const std::string& text) {
  std::string out = text.substr(0, 200);
  for (char& c : out) {
    if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) {
      c = '?';
    }
  }
  return out;
}

}  // namespace

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

bool DevServer::Impl::configureTLS(SSL_CTX& ctx) {
  SSL_CTX_set_min_proto_version(&ctx, TLS1_2_VERSION);
  SSL_CTX_set_options(&ctx, SSL_OP_NO_COMPRESSION | SSL_OP_NO_RENEGOTIATION);
  return SSL_CTX_use_certificate(&ctx, state.tls.certificate.get()) == 1 &&
         SSL_CTX_use_PrivateKey(&ctx, state.tls.key.get()) == 1 && SSL_CTX_check_private_key(&ctx) == 1 &&
         tracker.attach(&ctx);
}

void DevServer::Impl::configureHTTP() {
  // cpp-httplib's defaults (5 requests per connection, Nagle on) cap a client near 20
  // requests per second.
  http->set_keep_alive_max_count(kKeepAliveRequests);
  http->set_keep_alive_timeout(options.keepAlive.count());
  http->set_tcp_nodelay(true);
  http->set_payload_max_length(kMaxBody);
  // cpp-httplib's default also sets SO_REUSEPORT, which lets a second server bind the same port
  // and take half its connections. Address reuse alone still allows an immediate restart.
  http->set_socket_options([this](socket_t sock) {
    const int on = 1;
    setsockopt(sock, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    listeningSocket = sock;  // the only socket cpp-httplib opens before it listens
  });
  http->new_task_queue = [this] {
    markRunning();  // called once the server counts as running, so stop() will reach it
    return new WorkerPool(kInitialWorkers, kMaxWorkers);
  };
  http->set_pre_routing_handler([](const httplib::Request&, httplib::Response&) {
    tlRequest = RequestContext{std::chrono::steady_clock::now()};
    return httplib::Server::HandlerResponse::Unhandled;
  });
  // Every path and method goes to one dispatcher, which tells 404 from 405.
  const std::string everything = "[\\s\\S]*";
  const auto handler = [this](const httplib::Request& req, httplib::Response& res) { dispatch(req, res); };
  http->Get(everything, handler);
  http->Post(everything, handler);
  http->Put(everything, handler);
  http->Patch(everything, handler);
  http->Delete(everything, handler);
  http->Options(everything, handler);
  // Answers cpp-httplib makes itself (unparsable request, body too large) get a JSON body too.
  // It calls this for every status from 400 up; the dispatcher's answers all carry a
  // Content-Type already, its own never do.
  http->set_error_handler(
      httplib::Server::HandlerWithResponse([this](const httplib::Request& req, httplib::Response& res) {
        if (res.has_header("Content-Type")) {
          return httplib::Server::HandlerResponse::Unhandled;
        }
        if (!(options.admin && isAdminPath(req.path))) {
          if (const auto endpoint = endpointAtPath(req.path)) {
            stats.countRequest(*endpoint);
          }
          stats.countStatus(res.status);
        }
        res.set_content(errorBody(errorReason(res.status)), "application/json");
        return httplib::Server::HandlerResponse::Handled;
      }));
  http->set_exception_handler([](const httplib::Request&, httplib::Response& res, std::exception_ptr) {
    setAnswer(res, errorAnswer(500, "internal error"));
  });
  http->set_logger([this](const httplib::Request& req, const httplib::Response& res) { log(req, res); });
}

void DevServer::Impl::log(const httplib::Request& req, const httplib::Response& res) {
  const RequestContext context = std::exchange(tlRequest, RequestContext{});
  if (!options.logRequests) {
    return;
  }
  double ms = 0;
  if (context.start) {
    ms = std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - *context.start).count();
  }
  const std::string outcome = context.dropped ? "dropped" : std::to_string(res.status);
  std::fprintf(stderr, "%s %s %s %.1f ms\n", printable(req.method).c_str(), printable(req.path).c_str(),
               outcome.c_str(), ms);
}

void DevServer::Impl::dispatch(const httplib::Request& req, httplib::Response& res) {
  const bool admin = options.admin && isAdminPath(req.path);
  try {
    if (admin) {
      dispatchAdmin(req, res);
    } else {
      dispatchDevice(req, res);
    }
  } catch (const std::exception& error) {
    setAnswer(res, errorAnswer(500, std::string("internal error: ") + error.what()));
    if (!admin) {
      stats.countStatus(500);
    }
  }
}

void DevServer::Impl::dispatchDevice(const httplib::Request& req, httplib::Response& res) {
  const auto endpoint = endpointAtPath(req.path);
  if (!endpoint) {
    setAnswer(res, errorAnswer(404, "no such endpoint"));
    stats.countStatus(404);
    return;
  }
  stats.countRequest(*endpoint);
  const std::string_view method = endpointMethod(*endpoint);
  if (req.method != method && !(method == "GET" && req.method == "HEAD")) {
    setAnswer(res, errorAnswer(405, "method not allowed: use " + std::string(method)));
    res.set_header("Allow", method == "GET" ? "GET, HEAD" : "POST");
    stats.countStatus(405);
    return;
  }
  switch (*endpoint) {
    case Endpoint::setupCertificate:
      respond(*endpoint, req, res, services->setupCertificate());
      return;
    case Endpoint::sapSession:
      respond(*endpoint, req, res, services->sapSession(req.body));
      return;
    default:
      respond(*endpoint, req, res,
              services->tokenRequest(
                  *endpoint, SignedRequest{header(req, "session-identifier"), header(req, "signature"), req.body}));
      return;
  }
}

// The faults that rewrite an answer: the handshake's members (only of a successful handshake,
// the one answer that has them), then the status and the body.
static void applyFault(Endpoint endpoint, const Fault& fault, Answer& answer) {
  if (endpoint == Endpoint::sapSession && answer.status == 200 && (fault.sessionValidity || fault.sessionInfo)) {
    json document = json::parse(answer.body);
    if (fault.sessionValidity) {
      document["session-validity"] = *fault.sessionValidity;
    }
    if (fault.sessionInfo) {
      document["session-info"] = *fault.sessionInfo;
    }
    answer.body = document.dump(-1, ' ', false, json::error_handler_t::replace);
  }
  if (fault.status) {
    answer.status = *fault.status;
  }
  if (fault.body) {
    answer.body = *fault.body;
  }
}

// The right seq with a wrong MAC, or, where there was no signature to spoil, a random one.
static void corruptSignature(std::optional<std::array<uint8_t, 40>>& signature) {
  if (signature) {
    (*signature)[39] ^= 0x01;
    return;
  }
  signature.emplace();
  (*signature)[7] = 1;
  RAND_bytes(signature->data() + 8, 32);
}

// Faults act on the finished answer, so a verified request's seq is known for signing.
void DevServer::Impl::respond(Endpoint endpoint, const httplib::Request& req, httplib::Response& res, Answer answer) {
  const std::optional<Fault> fault = faults.take(endpoint);
  if (fault && ((fault->delay.count() > 0 && !pause(fault->delay)) || fault->drop)) {
    ConnectionTracker::cut(req.ssl);
    tlRequest.dropped = true;
    return;
  }
  if (fault) {
    applyFault(endpoint, *fault, answer);
  }
  if (answer.status == 204 || answer.status == 304) {
    answer.body.clear();  // what is signed must be what is sent
  }
  if (isTokenEndpoint(endpoint)) {
    signAnswer(answer, fault && fault->signature ? *fault->signature : SignatureFault::valid, res);
  }
  setAnswer(res, answer);
  stats.countStatus(answer.status);
}

void DevServer::Impl::signAnswer(const Answer& answer, SignatureFault mode, httplib::Response& res) {
  std::optional<std::array<uint8_t, 40>> signature;
  if (mode != SignatureFault::missing) {
    signature = services->sign(answer, answer.body);
  }
  if (mode == SignatureFault::corrupt) {
    corruptSignature(signature);
  }
  if (!signature) {
    return;
  }
  const std::string text = base64Encode(*signature);
  res.set_header("signature", mode == SignatureFault::padded ? " \t " + text + " \t" : text);
}

bool DevServer::Impl::pause(std::chrono::milliseconds delay) {
  std::unique_lock lock(stopMutex);
  return !stopWake.wait_for(lock, delay, [this] { return stopping; });
}

void DevServer::Impl::dispatchAdmin(const httplib::Request& req, httplib::Response& res) {
  const auto methodNotAllowed = [&res](const char* allowed) {
    setJSON(res, 405, json{{"error", std::string("method not allowed: use ") + allowed}});
    res.set_header("Allow", allowed);
  };
  if (req.path == "/_admin/faults") {
    if (req.method == "GET") {
      setJSON(res, 200, json{{"faults", faults.toJSON()}});
    } else if (req.method == "POST") {
      const json document = json::parse(req.body, nullptr, false);
      if (document.is_discarded()) {
        setJSON(res, 400, json{{"error", "body is not JSON"}});
        return;
      }
      try {
        faults.set(parseFaultRule(document));
      } catch (const std::invalid_argument& error) {
        setJSON(res, 400, json{{"error", error.what()}});
        return;
      }
      setJSON(res, 200, json{{"faults", faults.toJSON()}});
    } else if (req.method == "DELETE") {
      faults.clear();
      setJSON(res, 200, json{{"faults", json::array()}});
    } else {
      methodNotAllowed("GET, POST, DELETE");
    }
  } else if (req.path == "/_admin/stats") {
    if (req.method == "GET") {
      setJSON(res, 200, stats.toJSON());
    } else {
      methodNotAllowed("GET");
    }
  } else if (req.path == "/_admin/reset") {
    if (req.method == "POST") {
      faults.clear();
      stats.reset();
      setJSON(res, 200, json{{"faults", json::array()}, {"stats", stats.toJSON()}});
    } else {
      methodNotAllowed("POST");
    }
  } else {
    setJSON(res, 404, json{{"error", "no such admin endpoint"}});
  }
}

DevServer::DevServer(DevServerOptions options) : impl_(std::make_unique<Impl>(std::move(options))) {}

DevServer::~DevServer() { stop(); }

std::optional<std::string> DevServer::start() {
  Impl& d = *impl_;
  if (d.started) {
    return "the server was already started";
  }
  d.started = true;
  if (d.options.sessionValidity.count() < 0) {
    return "the session validity must not be negative";
  }
  try {
    d.state = prepareStateDirectory(d.options.stateDir);
    d.catalog = d.options.catalogFile ? Catalog::fromFile(*d.options.catalogFile) : Catalog::builtIn();
    d.sap = std::make_unique<TarvexSAPServer>(d.state.setupCertificateDER, d.state.setupKey.get());
  } catch (const std::exception& error) {
    return std::string(error.what());
  }
  d.services =
      std::make_unique<DeviceServices>(*d.sap, *d.catalog, d.state.setupKey.get(), d.options.sessionValidity, d.stats);
  d.http = std::make_unique<httplib::SSLServer>([&d](SSL_CTX& ctx) { return d.configureTLS(ctx); });
  if (!d.http->is_valid()) {
    d.http.reset();
    return "cannot set up TLS with " + (d.state.dir / "server.pem").string();
  }
  d.configureHTTP();
  const std::string where = d.options.host + ":" + std::to_string(d.options.port);
  const int port = d.options.port == 0 ? d.http->bind_to_any_port(d.options.host)
                                       : (d.http->bind_to_port(d.options.host, d.options.port) ? d.options.port : -1);
  if (port <= 0) {
    d.http.reset();
    return "cannot listen on " + where + " (address in use or not available)";
  }
  // cpp-httplib listens with a fixed backlog of 5; listening again on the bound socket sets ours.
  if (::listen(d.listeningSocket, d.options.listenBacklog) != 0) {
    d.http.reset();
    return "cannot listen on " + where + " with a backlog of " + std::to_string(d.options.listenBacklog);
  }
  d.port = static_cast<uint16_t>(port);
  std::future<void> running = d.running.get_future();
  d.listener = std::thread([&d] {
    d.http->listen_after_bind();
    d.markRunning();
  });
  running.wait();
  try {
    writeDaemonConfiguration(d.state.dir, baseURL());
  } catch (const std::exception& error) {
    stop();
    return std::string(error.what());
  }
  return std::nullopt;
}

void DevServer::stop() {
  Impl& d = *impl_;
  if (!d.http) {
    return;
  }
  {
    std::lock_guard lock(d.stopMutex);
    d.stopping = true;
  }
  d.stopWake.notify_all();
  d.http->stop();
  d.tracker.closeAll();
  if (d.listener.joinable()) {
    d.listener.join();
  }
  d.http.reset();
}

uint16_t DevServer::port() const { return impl_->port; }

std::string DevServer::baseURL() const {
  return "https://" + urlHost(impl_->options.host) + ":" + std::to_string(impl_->port);
}

const std::filesystem::path& DevServer::stateDir() const {
  return impl_->state.dir.empty() ? impl_->options.stateDir : impl_->state.dir;
}

nlohmann::json DevServer::statistics() const { return impl_->stats.toJSON(); }

}  // namespace devserver
