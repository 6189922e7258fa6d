// The reference-server world of a test binary: one zlka-devserver on loopback with its admin
// interface; the zlkad.toml it writes, made this process's configuration with the binary's device
// facts; its SAP root as the primitives' trust anchor; the developer settings suite; and a
// loopback URL that refuses every connection. A binary registers one world before its tests run,
//   ::testing::AddGlobalTestEnvironment(new zlkatest::ServerWorld(/*internalBuild=*/true));
// and its tests reach it through ServerWorld::get(). Failures to reach the server fail the test.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <string_view>

#include "common/child_process.h"
#include "platform/config/configuration.h"
#include "platform/config/settings_store.h"
#include "platform/values/value.h"

namespace devserver {
class DevServer;
}

namespace zlkatest {

// A server's faults (rules as in devserver/fault_table.h), set through its /_admin interface, and
// its statistics.
class AdminClient {
 public:
  explicit AdminClient(const devserver::DevServer& server) : server_(server) {}
  void setFault(const nlohmann::json& rule) const;
  void clearFaults() const;
  void reset() const;  // clears the faults and the statistics
  // Requests that reached one endpoint ("setup.crt", "sapSession", "queryProductPlan", ...), or
  // every endpoint when `endpoint` is empty.
  uint64_t requests(std::string_view endpoint = {}) const;
  // One statistic: "handshakes" (associations made), "verified" and "rejected" (token requests
  // whose signature the server accepted or refused).
  uint64_t stat(const std::string& name) const { return stats().value(name, uint64_t{0}); }
  nlohmann::json stats() const;  // as GET /_admin/stats answers

 private:
  void call(const std::string& method, const std::string& path, const std::string& body = {}) const;
  const devserver::DevServer& server_;
};

class ServerWorld : public ::testing::Environment {
 public:
  explicit ServerWorld(bool internalBuild);
  ~ServerWorld() override;
  // The world this binary registered; throws std::logic_error when it registered none.
  static ServerWorld& get();

  void SetUp() override;
  void TearDown() override;

  std::string baseURL() const;
  // A loopback base URL whose port is bound but never listens: every connection is refused.
  std::string refusedURL() const { return "https://127.0.0.1:" + std::to_string(refusedPort_); }
  const platform::Configuration& configuration() const { return configuration_; }
  const AdminClient& admin() const { return *admin_; }
  platform::SettingsStore& suite() const { return *suite_; }  // the developer settings suite

 private:
  bool internalBuild_;
  std::optional<TempDir> tempDir_;
  std::unique_ptr<devserver::DevServer> server_;
  platform::Configuration configuration_;
  std::unique_ptr<AdminClient> admin_;
  std::unique_ptr<platform::SettingsStore> suite_;
  int refusedSocket_ = -1;
  uint16_t refusedPort_ = 0;
};

// The process's configuration, changed by `change` for the life of the scope.
class ScopedConfiguration {
 public:
  explicit ScopedConfiguration(const std::function<void(platform::Configuration&)>& change);
  ~ScopedConfiguration() { platform::setCurrentConfiguration(*previous_); }
  ScopedConfiguration(const ScopedConfiguration&) = delete;
  ScopedConfiguration& operator=(const ScopedConfiguration&) = delete;

 private:
  std::shared_ptr<const platform::Configuration> previous_;
};

}  // namespace zlkatest
