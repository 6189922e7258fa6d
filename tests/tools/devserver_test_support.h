// Shared pieces of the zlka-devserver tests: a temporary state directory, a server started
// in-process on a free port, an HTTPS client that trusts the server's own CA, and a device
// that opens a real association over HTTP with the device-side primitives and signs and
// verifies token requests.
#pragma once

#include <httplib.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "devserver/dev_server.h"
#include "tarvexsap/tarvex_sap.h"

namespace devtest {

using Bytes = std::vector<uint8_t>;
using nlohmann::json;

inline constexpr const char* kSessionId = "5A0C9C1E-2B7D-4F3A-9E61-3C8D2F4B7A10";

class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::filesystem::path& path() const { return path_; }

 private:
  std::filesystem::path path_;
};

std::string readText(const std::filesystem::path& file);
void writeText(const std::filesystem::path& file, std::string_view text);
Bytes bytesOf(std::string_view text);
std::string textOf(const Bytes& bytes);

// One DER item: identifier octet, definite length, content.
Bytes derItem(uint8_t tag, const Bytes& content);
// A plausible accessory token item: SEQUENCE { OCTET STRING label }.
Bytes sampleToken(std::string_view label);

// A server on 127.0.0.1 with a fresh state directory; stopped and removed at destruction.
class TestServer {
 public:
  explicit TestServer(devserver::DevServerOptions options = {});
  // For a state directory the caller keeps (reuse tests).
  TestServer(devserver::DevServerOptions options, const std::filesystem::path& stateDir);
  ~TestServer();

  devserver::DevServer& server() { return *server_; }
  const std::filesystem::path& stateDir() const { return stateDir_; }
  std::unique_ptr<httplib::SSLClient> client() const;
  // GET /_admin/stats, parsed.
  json stats() const;
  // POST /_admin/faults with `fault`; fails the test unless it answers 200.
  void setFault(const json& fault) const;

 private:
  std::unique_ptr<TempDir> ownDir_;
  std::filesystem::path stateDir_;
  std::unique_ptr<devserver::DevServer> server_;
};

// The device side of one association, torn down at destruction. The trust anchor is the
// server's SAP root.
class Device {
 public:
  explicit Device(const TestServer& server, std::string sessionId = kSessionId);
  ~Device();
  Device(const Device&) = delete;
  Device& operator=(const Device&) = delete;

  // Fetches the setup certificate and runs the handshake; fails the test on any error.
  bool associate(httplib::SSLClient& client);
  // Step one alone: the 90-byte handshake request for `certificate`.
  Bytes handshakeRequest(const Bytes& certificate);
  // Step two alone: TarvexSAPExchange status for the decoded session info.
  int32_t acceptSessionInfo(const Bytes& sessionInfo);

  std::string sign(std::string_view body);
  // True if `signatureBase64` is a valid answer signature over `body`.
  bool verify(std::string_view signatureBase64, std::string_view body);
  // True if the response carries a "signature" header that verifies over its body.
  bool verifies(const httplib::Response& response);

  // POST /deviceservices/<endpoint> with the session headers and a fresh signature.
  httplib::Result post(httplib::SSLClient& client, std::string_view endpoint, const std::string& body);
  const std::string& sessionId() const { return sessionId_; }

 private:
  QVSAPContextOpaque_* context_ = nullptr;
  TarvexHWInfo_ hw_{};
  std::string sessionId_;
};

// Server options for the common cases (designated initialisers would warn about the rest);
// validityOptions() has the admin interface on too.
devserver::DevServerOptions adminOptions();
devserver::DevServerOptions validityOptions(std::chrono::seconds validity);
devserver::DevServerOptions catalogOptions(const std::filesystem::path& catalog,
                                           const std::filesystem::path& stateDir = {});

// {"tokens": [base64...], "uuid": uuid} plus, when given, "locale" and "request_info".
std::string tokenBody(const std::vector<Bytes>& tokens, std::string_view uuid = "accessory-uuid",
                      std::optional<std::string> locale = std::nullopt, std::optional<json> requestInfo = std::nullopt);

httplib::Headers sessionHeaders(std::string_view sessionId, std::string_view signature);

}  // namespace devtest
