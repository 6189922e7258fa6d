// zlka-devserver: the reference device-services server for zlkad, its demo and its tests.
#include <pthread.h>
#include <signal.h>

#include <CLI/CLI.hpp>
#include <cstdio>
#include <cstring>

#include "devserver/dev_server.h"
#include "devserver/listen_address.h"

namespace {

constexpr const char* kFooter = R"(Endpoints (HTTPS, under the printed base URL):
  GET  /deviceservices/setup.crt          the setup certificate (DER)
  POST /deviceservices/sapSession         secure-association handshake
  POST /deviceservices/queryProductPlan   signed: product plan metadata for a token
  POST /deviceservices/activateAccessory  signed: replacement token for a token
  POST /deviceservices/ackAccessory       signed: activation confirmation (204)

The state directory keeps the TLS CA (ca.pem), the server certificate, the SAP root
(sap-root.pem, the daemon's trust anchor) and the setup certificate; they are made on first
start and reused afterwards. zlkad.toml, rewritten at every start, points zlkad at this server:
  zlkad --config DIR/zlkad.toml ...
  curl --cacert DIR/ca.pem https://127.0.0.1:PORT/deviceservices/setup.crt -o setup.crt

Catalogue file (--catalog):
  {"default": PLAN, "tokens": {"<sha256 hex of the token's first item>": PLAN}}
  PLAN = {"ppid": "...", "default_locale": "en_US", "metadata": {"en_US": {...}, ...}}

With --admin:
  POST   /_admin/faults  {"endpoint": "sapSession"|...|"*", "status": 500, "delay_ms": 2000,
                          "body": "...", "signature": "valid"|"missing"|"corrupt",
                          "drop": true, "session_validity": <any JSON>, "session_info": "...",
                          "remaining": N}
  GET    /_admin/faults  DELETE /_admin/faults  GET /_admin/stats  POST /_admin/reset
)";

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{
      "zlka-devserver: reference device-services server for zlkad (HTTPS, secure-association\n"
      "sessions, product plans, activation tokens)."};
  std::string listen = "127.0.0.1:0";
  std::string stateDir;
  std::string catalog;
  bool admin = false;
  int64_t sessionValidity = 3600;
  int64_t keepAlive = 60;
  int listenBacklog = 128;
  app.add_option("--listen", listen, "Address to serve on; [::1]:PORT for IPv6, port 0 picks a free one")
      ->type_name("HOST:PORT")
      ->capture_default_str();
  app.add_option("--state-dir", stateDir, "Directory for certificates, keys and zlkad.toml (created 0700)")
      ->type_name("DIR")
      ->required();
  app.add_option("--catalog", catalog, "JSON catalogue of product plans (default: a built-in plan for every token)")
      ->type_name("FILE")
      ->check(CLI::ExistingFile.description(""));
  app.add_flag("--admin", admin, "Serve /_admin/faults, /_admin/stats and /_admin/reset");
  app.add_option("--session-validity", sessionValidity, "Session time-to-live announced by the handshake")
      ->type_name("SECONDS")
      ->check(CLI::Range(int64_t{0}, int64_t{10} * 365 * 24 * 3600))
      ->capture_default_str();
  app.add_option("--keep-alive", keepAlive, "Seconds an idle connection is kept open before the server closes it")
      ->type_name("SECONDS")
      ->check(CLI::Range(int64_t{1}, int64_t{3600}))
      ->capture_default_str();
  app.add_option("--listen-backlog", listenBacklog, "Connections that may wait to be accepted (the kernel caps it)")
      ->type_name("N")
      ->check(CLI::Range(1, 65535))
      ->capture_default_str();
  app.footer(kFooter);
  CLI11_PARSE(app, argc, argv);

  const auto address = devserver::parseListenAddress(listen);
  if (!address) {
    std::fprintf(stderr, "zlka-devserver: --listen: \"%s\" is not HOST:PORT\n", listen.c_str());
    return 2;
  }
  devserver::DevServerOptions options;
  options.host = address->host;
  options.port = address->port;
  options.stateDir = stateDir;
  if (!catalog.empty()) {
    options.catalogFile = catalog;
  }
  options.admin = admin;
  options.sessionValidity = std::chrono::seconds(sessionValidity);
  options.logRequests = true;
  options.keepAlive = std::chrono::seconds(keepAlive);
  options.listenBacklog = listenBacklog;

  // Every thread inherits this mask, so the signals wait for sigwait() below.
  sigset_t stopSignals;
  sigemptyset(&stopSignals);
  sigaddset(&stopSignals, SIGINT);
  sigaddset(&stopSignals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
  signal(SIGPIPE, SIG_IGN);

  devserver::DevServer server(options);
  if (const auto error = server.start()) {
    std::fprintf(stderr, "zlka-devserver: %s\n", error->c_str());
    return 1;
  }
  std::printf("zlka-devserver listening on %s (state in %s)\n", server.baseURL().c_str(), server.stateDir().c_str());
  std::fflush(stdout);

  int received = 0;
  sigwait(&stopSignals, &received);
  std::fprintf(stderr, "zlka-devserver: %s, stopping\n", strsignal(received));
  server.stop();
  return 0;
}
