// A DevServer's set-up and life: state, catalogue and SAP server, cpp-httplib's configuration
// (TLS, keep-alive, routes, error answers, request log), start and stop.
#include "devserver/dev_server.h"

#include <httplib.h>

#include <cstdio>
#include <nlohmann/json.hpp>
#include <utility>

#include "devserver/dev_server_impl.h"
#include "devserver/listen_address.h"
#include "devserver/worker_pool.h"

namespace devserver {

using nlohmann::json;

thread_local RequestContext tlRequest;

namespace {

constexpr std::size_t kMaxBody = 1024 * 1024;
constexpr std::size_t kInitialWorkers = 4;
constexpr std::size_t kMaxWorkers = 256;
constexpr std::size_t kKeepAliveRequests = 1000000;

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
  platform::Result<DevServerState> state = prepareStateDirectory(d.options.stateDir);
  if (!state) {
    return state.error();
  }
  d.state = *std::move(state);
  platform::Result<Catalog> catalog =
      d.options.catalogFile ? Catalog::fromFile(*d.options.catalogFile) : Catalog::builtIn();
  if (!catalog) {
    return catalog.error();
  }
  d.catalog = *std::move(catalog);
  platform::Result<std::unique_ptr<TarvexSAPServer>> sap =
      TarvexSAPServer::create(d.state.setupCertificateDER, d.state.setupKey.get());
  if (!sap) {
    return sap.error();
  }
  d.sap = std::move(*sap);
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
  if (const platform::Done failed = writeDaemonConfiguration(d.state.dir, baseURL())) {
    stop();
    return failed->message;
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
