#include "network_test_environment.h"

#include <arpa/inet.h>
#include <httplib.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "network/zlka_network_constants.h"
#include "platform/device_facts.h"
#include "platform/settings_store.h"
#include "tarvexsap/tarvex_sap.h"

namespace nettest {

namespace fs = std::filesystem;
using nlohmann::json;

namespace {

NetworkEnvironment* gEnvironment = nullptr;

std::string readFile(const fs::path& file) {
  std::ifstream in(file, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  return std::move(text).str();
}

std::unique_ptr<httplib::SSLClient> adminConnection(uint16_t port, const fs::path& caFile) {
  auto client = std::make_unique<httplib::SSLClient>("127.0.0.1", port);
  client->set_ca_cert_path(caFile.c_str());
  client->enable_server_certificate_verification(true);
  client->set_read_timeout(60, 0);
  client->set_write_timeout(60, 0);
  return client;
}

}  // namespace

// ---- AdminClient

void AdminClient::setFault(const json& rule) const {
  const auto result = adminConnection(port_, caFile_)->Post("/_admin/faults", rule.dump(), "application/json");
  ASSERT_TRUE(result) << "POST /_admin/faults: no answer";
  ASSERT_EQ(result->status, 200) << rule.dump() << ": " << result->body;
}

void AdminClient::clearFaults() const {
  const auto result = adminConnection(port_, caFile_)->Delete("/_admin/faults");
  ASSERT_TRUE(result) << "DELETE /_admin/faults: no answer";
  ASSERT_EQ(result->status, 200) << result->body;
}

void AdminClient::reset() const {
  const auto result = adminConnection(port_, caFile_)->Post("/_admin/reset", "", "application/json");
  ASSERT_TRUE(result) << "POST /_admin/reset: no answer";
  ASSERT_EQ(result->status, 200) << result->body;
}

json AdminClient::stats() const {
  const auto result = adminConnection(port_, caFile_)->Get("/_admin/stats");
  if (!result || result->status != 200) {
    ADD_FAILURE() << "GET /_admin/stats failed";
    return json::object();
  }
  return json::parse(result->body);
}

uint64_t AdminClient::requests(std::string_view endpoint) const {
  return stats()["requests"].value(std::string(endpoint), uint64_t{0});
}
uint64_t AdminClient::handshakes() const { return stats().value("handshakes", uint64_t{0}); }
uint64_t AdminClient::verified() const { return stats().value("verified", uint64_t{0}); }
uint64_t AdminClient::rejected() const { return stats().value("rejected", uint64_t{0}); }

// ---- SettingsSuite

void SettingsSuite::set(std::string_view key, const platform::Value& value) const {
  platform::SettingsStore store(ZLKAUserDefaultsDomain, directory_);
  ASSERT_TRUE(store.setObject(key, value)) << "cannot write " << key << " to " << file();
}

void SettingsSuite::remove(std::string_view key) const {
  platform::SettingsStore store(ZLKAUserDefaultsDomain, directory_);
  ASSERT_TRUE(store.removeObject(key)) << "cannot remove " << key << " from " << file();
}

void SettingsSuite::clear() const {
  std::error_code ignored;
  fs::remove(file(), ignored);
}

void SettingsSuite::writeRaw(std::string_view text) const {
  std::ofstream out(file(), std::ios::binary | std::ios::trunc);
  out << text;
  ASSERT_TRUE(out.good()) << "cannot write " << file();
}

fs::path SettingsSuite::file() const { return directory_ / (std::string(ZLKAUserDefaultsDomain) + ".json"); }

// ---- NetworkEnvironment

NetworkEnvironment::NetworkEnvironment(bool internalBuild) : internalBuild_(internalBuild) { gEnvironment = this; }

NetworkEnvironment::~NetworkEnvironment() {
  if (refusedSocket_ >= 0) ::close(refusedSocket_);
  if (gEnvironment == this) gEnvironment = nullptr;
}

NetworkEnvironment& environment() {
  if (!gEnvironment) throw std::logic_error("this test binary registers no NetworkEnvironment");
  return *gEnvironment;
}

void NetworkEnvironment::SetUp() {
  // A connection that the server cuts must fail a write, not end the process.
  signal(SIGPIPE, SIG_IGN);

  std::string pattern = (fs::temp_directory_path() / "zlka-network-test-XXXXXX").string();
  ASSERT_NE(mkdtemp(pattern.data()), nullptr);
  tempDir_ = pattern;
  stateDir_ = tempDir_ / "state";

  devserver::DevServerOptions options;
  options.stateDir = stateDir_;
  options.admin = true;
  server_ = std::make_unique<devserver::DevServer>(options);
  if (auto error = server_->start()) FAIL() << "zlka-devserver did not start: " << *error;

  std::string error;
  std::optional<platform::Configuration> loaded = platform::loadConfiguration(stateDir_ / "zlkad.toml", &error);
  ASSERT_TRUE(loaded) << error;
  configuration_ = std::move(*loaded);
  configuration_.device.internalBuild = internalBuild_;
  platform::setCurrentConfiguration(configuration_);
  platform::setDeviceFacts(configuration_.device);

  const std::string anchor = readFile(configuration_.trustAnchor);
  const TarvexSAPConfig sapConfig{reinterpret_cast<const uint8_t*>(anchor.data()), anchor.size(), nullptr};
  ASSERT_EQ(TarvexSAPConfigure(&sapConfig), kTarvexSAPOK);

  // Bound and never listening: the kernel refuses every connection to it.
  refusedSocket_ = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  ASSERT_GE(refusedSocket_, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  ASSERT_EQ(::bind(refusedSocket_, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  socklen_t length = sizeof address;
  ASSERT_EQ(::getsockname(refusedSocket_, reinterpret_cast<sockaddr*>(&address), &length), 0);
  refusedPort_ = ntohs(address.sin_port);

  log_ = std::make_unique<LogCapture>();
  admin_ = std::make_unique<AdminClient>(server_->port(), configuration_.caFile);
  suite_ = std::make_unique<SettingsSuite>(configuration_.settingsDirectory);
}

void NetworkEnvironment::TearDown() {
  if (server_) server_->stop();
  log_.reset();
  std::error_code ignored;
  if (!tempDir_.empty()) fs::remove_all(tempDir_, ignored);
}

std::string NetworkEnvironment::refusedURL() const { return "https://127.0.0.1:" + std::to_string(refusedPort_); }

// ---- ScopedConfiguration

ScopedConfiguration::ScopedConfiguration(const std::function<void(platform::Configuration&)>& change)
    : previous_(platform::currentConfiguration()) {
  platform::Configuration changed = *previous_;
  change(changed);
  platform::setCurrentConfiguration(std::move(changed));
}

ScopedConfiguration::~ScopedConfiguration() { platform::setCurrentConfiguration(*previous_); }

// ---- NetworkTest

void NetworkTest::SetUp() {
  ASSERT_NO_FATAL_FAILURE(admin().reset());
  suite().clear();
  installSession();
  log().clear();
}

void NetworkTest::TearDown() {
  admin().clearFaults();
  suite().clear();
}

std::shared_ptr<TarvexSAPSession> NetworkTest::installSession(TarvexSAPPrimitives primitives) {
  std::shared_ptr<ZLKANetwork> net = network();
  auto session = TarvexSAPSession::sessionWithDelegate(net, std::move(primitives));
  net->setTarvexSAPSession(session);
  return session;
}

}  // namespace nettest
