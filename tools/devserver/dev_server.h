// zlka-devserver, the reference device-services server, as an object that serves HTTPS on
// threads of its own (the command-line program and the tests both start it this way).
//
//   DevServerOptions options;
//   options.stateDir = dir;
//   options.admin = true;
//   DevServer server(options);
//   if (auto error = server.start()) { ... *error says what went wrong ... }
//   ... requests to server.baseURL() + "/deviceservices/..." ...
//   server.stop(); // also done by the destructor
//
// start() prepares the state directory (certificates, keys; see state_dir.h), loads the
// catalogue (catalog.h), binds (port 0: a free port), starts serving and then writes
// <state dir>/zlkad.toml with the real base URL. It may be called once. stop() ends every
// connection at once, interrupts fault delays and joins every thread; call it from one thread.
// Endpoints: GET /deviceservices/setup.crt; POST /deviceservices/sapSession,
// /deviceservices/queryProductPlan, /deviceservices/activateAccessory,
// /deviceservices/ackAccessory; with `admin`, /_admin/faults, /_admin/stats and /_admin/reset.
// Every error answer is a JSON object {"error": "..."}. The server's threads block SIGPIPE; the
// process's signal handling is left as it is.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>

namespace devserver {

struct DevServerOptions {
  std::string host = "127.0.0.1";
  uint16_t port = 0;  // 0: a free port
  std::filesystem::path stateDir;
  std::optional<std::filesystem::path> catalogFile;  // none: the built-in catalogue
  bool admin = false;                                // serve /_admin/*
  std::chrono::seconds sessionValidity{3600};        // time-to-live of an association
  bool logRequests = false;                          // one line per request on stderr
  std::chrono::seconds keepAlive{60};                // an idle connection is closed after this
  int listenBacklog = 128;                           // connections waiting to be accepted
};

class DevServer {
 public:
  explicit DevServer(DevServerOptions options);
  ~DevServer();
  DevServer(const DevServer&) = delete;
  DevServer& operator=(const DevServer&) = delete;

  // nullopt once serving; otherwise what went wrong (and nothing is left running).
  [[nodiscard]] std::optional<std::string> start();
  void stop();

  uint16_t port() const;                          // the bound port, 0 before start()
  std::string baseURL() const;                    // "https://127.0.0.1:PORT", no trailing slash
  const std::filesystem::path& stateDir() const;  // absolute once started
  nlohmann::json statistics() const;              // what GET /_admin/stats answers, admin or not

 private:
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace devserver
