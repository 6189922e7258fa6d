// The world a network test binary runs in: one zlka-devserver on loopback (admin interface on),
// the configuration it writes with the device facts of the binary (internal build or production
// device), the session library's trust anchor, the developer settings suite, and a log capture.
// Each binary registers one NetworkEnvironment; NetworkTest resets faults, statistics, the suite,
// the log and the secure-association session before every test.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>

#include "devserver/dev_server.h"
#include "log_capture.h"
#include "network/zlka_network.h"
#include "platform/configuration.h"
#include "platform/value.h"
#include "sap/tarvex_sap_primitives.h"
#include "sap/tarvex_sap_session.h"

namespace nettest {

// The admin interface of the server: faults and statistics.
class AdminClient {
 public:
  AdminClient(uint16_t port, std::filesystem::path caFile) : port_(port), caFile_(std::move(caFile)) {}

  // POST /_admin/faults; the test fails unless the server takes the rule.
  void setFault(const nlohmann::json& rule) const;
  void clearFaults() const;
  // Faults and statistics both.
  void reset() const;
  nlohmann::json stats() const;
  uint64_t requests(std::string_view endpoint) const;
  uint64_t handshakes() const;
  uint64_t verified() const;
  uint64_t rejected() const;

 private:
  uint16_t port_;
  std::filesystem::path caFile_;
};

// The developer settings suite, written as a developer would with the settings tool.
class SettingsSuite {
 public:
  explicit SettingsSuite(std::filesystem::path directory) : directory_(std::move(directory)) {}

  void set(std::string_view key, const platform::Value& value) const;
  void remove(std::string_view key) const;
  void clear() const;
  void writeRaw(std::string_view text) const;
  std::filesystem::path file() const;

 private:
  std::filesystem::path directory_;
};

class NetworkEnvironment : public ::testing::Environment {
 public:
  explicit NetworkEnvironment(bool internalBuild);
  ~NetworkEnvironment() override;

  void SetUp() override;
  void TearDown() override;

  bool internalBuild() const { return internalBuild_; }
  devserver::DevServer& server() { return *server_; }
  std::string baseURL() const { return server_->baseURL(); }
  uint16_t port() const { return server_->port(); }
  const std::filesystem::path& stateDir() const { return stateDir_; }
  // A loopback base URL whose port is bound but never listens: connections are refused.
  std::string refusedURL() const;
  // The configuration as the environment set it up (tests may change it in a scope).
  const platform::Configuration& configuration() const { return configuration_; }

  LogCapture& log() { return *log_; }
  const AdminClient& admin() const { return *admin_; }
  const SettingsSuite& suite() const { return *suite_; }

 private:
  bool internalBuild_;
  std::filesystem::path tempDir_;
  std::filesystem::path stateDir_;
  std::unique_ptr<devserver::DevServer> server_;
  platform::Configuration configuration_;
  std::unique_ptr<LogCapture> log_;
  std::unique_ptr<AdminClient> admin_;
  std::unique_ptr<SettingsSuite> suite_;
  int refusedSocket_ = -1;
  uint16_t refusedPort_ = 0;
};

// The environment of this test binary.
NetworkEnvironment& environment();

// Changes the configuration in force for the life of the scope.
class ScopedConfiguration {
 public:
  explicit ScopedConfiguration(const std::function<void(platform::Configuration&)>& change);
  ~ScopedConfiguration();
  ScopedConfiguration(const ScopedConfiguration&) = delete;
  ScopedConfiguration& operator=(const ScopedConfiguration&) = delete;

 private:
  std::shared_ptr<const platform::Configuration> previous_;
};

// Resets the server's faults and statistics, the settings suite and the log, and gives the shared
// ZLKANetwork a fresh closed session, so that every test starts from the same place.
class NetworkTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  static std::shared_ptr<ZLKANetwork> network() { return ZLKANetwork::sharedInstance(); }
  // Replaces the network's session with a new closed one over these primitives.
  static std::shared_ptr<TarvexSAPSession> installSession(
      TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library());

  static LogCapture& log() { return environment().log(); }
  static const AdminClient& admin() { return environment().admin(); }
  static const SettingsSuite& suite() { return environment().suite(); }
};

}  // namespace nettest
