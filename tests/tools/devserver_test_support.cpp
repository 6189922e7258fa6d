#include "devserver_test_support.h"

#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <sstream>

#include "devserver/strict_base64.h"

namespace devtest {

namespace fs = std::filesystem;

namespace {
// A connection the server cut must fail the client's write, not kill the test process.
const bool kPipeIgnored = [] {
  signal(SIGPIPE, SIG_IGN);
  return true;
}();
}  // namespace

TempDir::TempDir() {
  std::string pattern = (fs::temp_directory_path() / "zlka-devserver-test-XXXXXX").string();
  if (mkdtemp(pattern.data()) == nullptr) {
    throw std::runtime_error("mkdtemp failed");
  }
  path_ = pattern;
}

TempDir::~TempDir() {
  std::error_code ignored;
  fs::remove_all(path_, ignored);
}

std::string readText(const fs::path& file) {
  std::ifstream in(file, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  return std::move(text).str();
}

void writeText(const fs::path& file, std::string_view text) {
  std::ofstream out(file, std::ios::binary | std::ios::trunc);
  out << text;
}

Bytes bytesOf(std::string_view text) { return Bytes(text.begin(), text.end()); }

std::string textOf(const Bytes& bytes) { return std::string(bytes.begin(), bytes.end()); }

Bytes derItem(uint8_t tag, const Bytes& content) {
  Bytes out;
  if (content.size() < 0x80) {
    out = {tag, static_cast<uint8_t>(content.size())};
  } else {
    out = {tag, 0x82, static_cast<uint8_t>(content.size() >> 8), static_cast<uint8_t>(content.size())};
  }
  out.resize(out.size() + content.size());
  std::copy(content.begin(), content.end(), out.end() - static_cast<std::ptrdiff_t>(content.size()));
  return out;
}

Bytes sampleToken(std::string_view label) { return derItem(0x30, derItem(0x04, bytesOf(label))); }

TestServer::TestServer(devserver::DevServerOptions options) : ownDir_(std::make_unique<TempDir>()) {
  stateDir_ = ownDir_->path() / "state";
  options.stateDir = stateDir_;
  server_ = std::make_unique<devserver::DevServer>(std::move(options));
  if (const auto error = server_->start()) {
    throw std::runtime_error("server did not start: " + *error);
  }
}

TestServer::TestServer(devserver::DevServerOptions options, const fs::path& stateDir) : stateDir_(stateDir) {
  options.stateDir = stateDir_;
  server_ = std::make_unique<devserver::DevServer>(std::move(options));
  if (const auto error = server_->start()) {
    throw std::runtime_error("server did not start: " + *error);
  }
}

TestServer::~TestServer() { server_->stop(); }

std::unique_ptr<httplib::SSLClient> TestServer::client() const {
  auto client = std::make_unique<httplib::SSLClient>("127.0.0.1", server_->port());
  client->set_ca_cert_path((stateDir_ / "ca.pem").c_str());
  client->enable_server_certificate_verification(true);
  client->set_keep_alive(true);
  client->set_read_timeout(60, 0);
  client->set_write_timeout(60, 0);
  return client;
}

json TestServer::stats() const {
  const auto result = client()->Get("/_admin/stats");
  if (!result || result->status != 200) {
    ADD_FAILURE() << "GET /_admin/stats failed";
    return json::object();
  }
  return json::parse(result->body);
}

void TestServer::setFault(const json& fault) const {
  const auto result = client()->Post("/_admin/faults", fault.dump(), "application/json");
  ASSERT_TRUE(result);
  ASSERT_EQ(result->status, 200) << result->body;
}

Device::Device(const TestServer& server, std::string sessionId) : sessionId_(std::move(sessionId)) {
  const std::string anchor = readText(server.stateDir() / "sap-root.pem");
  const TarvexSAPConfig config{reinterpret_cast<const uint8_t*>(anchor.data()), anchor.size(), nullptr};
  EXPECT_EQ(TarvexSAPConfigure(&config), kTarvexSAPOK);
  EXPECT_EQ(TarvexSAPInit(&context_, &hw_), kTarvexSAPOK);
}

Device::~Device() { TarvexSAPTeardown(context_); }

Bytes Device::handshakeRequest(const Bytes& certificate) {
  uint8_t* out = nullptr;
  uint32_t outLength = 0;
  uint8_t returnCode = 0;
  const int32_t status =
      TarvexSAPExchange(200, &hw_, context_, certificate.data(), certificate.size(), &out, &outLength, &returnCode);
  Bytes request(out, out + (out != nullptr ? outLength : 0));
  std::free(out);
  EXPECT_EQ(status, kTarvexSAPOK) << TarvexSAPStatusName(status);
  EXPECT_EQ(returnCode, 1);
  return request;
}

int32_t Device::acceptSessionInfo(const Bytes& sessionInfo) {
  uint8_t* out = nullptr;
  uint32_t outLength = 0;
  uint8_t returnCode = 255;
  const int32_t status =
      TarvexSAPExchange(200, &hw_, context_, sessionInfo.data(), sessionInfo.size(), &out, &outLength, &returnCode);
  std::free(out);
  return status;
}

bool Device::associate(httplib::SSLClient& client) {
  const auto certificate = client.Get("/deviceservices/setup.crt");
  if (!certificate || certificate->status != 200) {
    ADD_FAILURE() << "setup.crt not served";
    return false;
  }
  const Bytes request = handshakeRequest(bytesOf(certificate->body));
  const json body = {{"session-request", devserver::base64Encode(request)}, {"session-identifier", sessionId_}};
  const auto answer = client.Post("/deviceservices/sapSession", body.dump(), "application/json");
  if (!answer || answer->status != 200) {
    ADD_FAILURE() << "handshake refused: " << (answer ? answer->body : "no answer");
    return false;
  }
  const json reply = json::parse(answer->body);
  const auto info = devserver::base64DecodeStrict(reply.at("session-info").get<std::string>());
  if (!info) {
    ADD_FAILURE() << "session-info is not base64";
    return false;
  }
  const int32_t status = acceptSessionInfo(*info);
  EXPECT_EQ(status, kTarvexSAPOK) << TarvexSAPStatusName(status);
  return status == kTarvexSAPOK;
}

std::string Device::sign(std::string_view body) {
  uint8_t* signature = nullptr;
  uint32_t length = 0;
  const int32_t status =
      TarvexSAPSign(context_, reinterpret_cast<const uint8_t*>(body.data()), body.size(), &signature, &length);
  EXPECT_EQ(status, kTarvexSAPOK) << TarvexSAPStatusName(status);
  const std::string text = signature != nullptr ? devserver::base64Encode(std::span(signature, length)) : "";
  std::free(signature);
  return text;
}

bool Device::verify(std::string_view signatureBase64, std::string_view body) {
  const auto signature = devserver::base64DecodeStrict(signatureBase64);
  if (!signature) {
    return false;
  }
  Bytes data = bytesOf(body);
  return TarvexSAPVerify(context_, signature->data(), signature->size(), data.data(), data.size()) == kTarvexSAPOK;
}

bool Device::verifies(const httplib::Response& response) {
  return response.has_header("signature") && verify(response.get_header_value("signature"), response.body);
}

httplib::Result Device::post(httplib::SSLClient& client, std::string_view endpoint, const std::string& body) {
  return client.Post(("/deviceservices/" + std::string(endpoint)).c_str(), sessionHeaders(sessionId_, sign(body)), body,
                     "application/json");
}

devserver::DevServerOptions adminOptions() {
  devserver::DevServerOptions options;
  options.admin = true;
  return options;
}

devserver::DevServerOptions validityOptions(std::chrono::seconds validity) {
  devserver::DevServerOptions options = adminOptions();
  options.sessionValidity = validity;
  return options;
}

devserver::DevServerOptions catalogOptions(const fs::path& catalog, const fs::path& stateDir) {
  devserver::DevServerOptions options;
  options.catalogFile = catalog;
  options.stateDir = stateDir;
  return options;
}

std::string tokenBody(const std::vector<Bytes>& tokens, std::string_view uuid, std::optional<std::string> locale,
                      std::optional<json> requestInfo) {
  json body = {{"tokens", json::array()}, {"uuid", uuid}};
  for (const Bytes& token : tokens) {
    body["tokens"].push_back(devserver::base64Encode(token));
  }
  if (locale) {
    body["locale"] = *locale;
  }
  if (requestInfo) {
    body["request_info"] = *requestInfo;
  }
  return body.dump();
}

httplib::Headers sessionHeaders(std::string_view sessionId, std::string_view signature) {
  return {{"session-identifier", std::string(sessionId)}, {"signature", std::string(signature)}};
}

}  // namespace devtest
