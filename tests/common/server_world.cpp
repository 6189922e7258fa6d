#include "common/server_world.h"

#include <arpa/inet.h>
#include <httplib.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <stdexcept>

#include "devserver/dev_server.h"
#include "network/zlka_network_constants.h"
#include "platform/config/device_facts.h"
#include "tarvexsap/tarvex_sap.h"

namespace zlkatest {

namespace fs = std::filesystem;
using nlohmann::json;

namespace {
ServerWorld* gWorld = nullptr;
}  // namespace

void AdminClient::call(const std::string& method, const std::string& path, const std::string& body) const {
  httplib::SSLClient client("127.0.0.1", server_.port());
  client.set_ca_cert_path((server_.stateDir() / "ca.pem").c_str());
  client.enable_server_certificate_verification(true);
  client.set_read_timeout(60, 0);
  auto result = method == "DELETE" ? client.Delete(path) : client.Post(path, body, "application/json");
  if (!result || result->status != 200)
    ADD_FAILURE() << method << " " << path << " " << body << ": " << (result ? result->body : "no answer");
}

void AdminClient::setFault(const json& rule) const { call("POST", "/_admin/faults", rule.dump()); }
void AdminClient::clearFaults() const { call("DELETE", "/_admin/faults"); }
void AdminClient::reset() const { call("POST", "/_admin/reset"); }
json AdminClient::stats() const { return server_.statistics(); }

uint64_t AdminClient::requests(std::string_view endpoint) const {
  const json all = stats()["requests"];
  if (!endpoint.empty()) return all.value(std::string(endpoint), uint64_t{0});
  uint64_t sum = 0;
  for (const auto& [name, n] : all.items()) sum += n.get<uint64_t>();
  return sum;
}

ServerWorld::ServerWorld(bool internalBuild) : internalBuild_(internalBuild) { gWorld = this; }

ServerWorld::~ServerWorld() {
  if (refusedSocket_ >= 0) ::close(refusedSocket_);
  if (gWorld == this) gWorld = nullptr;
}

ServerWorld& ServerWorld::get() {
  if (!gWorld) throw std::logic_error("this test binary registers no ServerWorld");
  return *gWorld;
}

std::string ServerWorld::baseURL() const { return server_->baseURL(); }

void ServerWorld::SetUp() {
  // A connection that the server cuts must fail a write, not end the process.
  signal(SIGPIPE, SIG_IGN);
  devserver::DevServerOptions options;
  options.stateDir = tempDir_.emplace().path() / "state";
  options.admin = true;
  server_ = std::make_unique<devserver::DevServer>(options);
  if (auto error = server_->start()) FAIL() << "zlka-devserver did not start: " << *error;

  platform::Result<platform::Configuration> loaded = platform::loadConfiguration(options.stateDir / "zlkad.toml");
  ASSERT_TRUE(loaded) << loaded.error();
  configuration_ = std::move(*loaded);
  configuration_.device.internalBuild = internalBuild_;
  platform::setCurrentConfiguration(configuration_);
  platform::setDeviceFacts(configuration_.device);

  const std::string pem = readFile(configuration_.trustAnchor);
  const TarvexSAPConfig sapConfig{reinterpret_cast<const uint8_t*>(pem.data()), pem.size(), nullptr};
  ASSERT_EQ(TarvexSAPConfigure(&sapConfig), kTarvexSAPOK);

  // Bound and never listening: the kernel refuses every connection to it.
  refusedSocket_ = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof address;
  ASSERT_EQ(::bind(refusedSocket_, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(::getsockname(refusedSocket_, reinterpret_cast<sockaddr*>(&address), &length), 0);
  refusedPort_ = ntohs(address.sin_port);

  admin_ = std::make_unique<AdminClient>(*server_);
  suite_ = std::make_unique<platform::SettingsStore>(ZLKAUserDefaultsDomain, configuration_.settingsDirectory);
}

void ServerWorld::TearDown() {
  if (server_) server_->stop();
  tempDir_.reset();
}

ScopedConfiguration::ScopedConfiguration(const std::function<void(platform::Configuration&)>& change)
    : previous_(platform::currentConfiguration()) {
  platform::Configuration changed = *previous_;
  change(changed);
  platform::setCurrentConfiguration(std::move(changed));
}

}  // namespace zlkatest
