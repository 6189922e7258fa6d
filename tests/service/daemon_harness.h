// What an end-to-end test of zlkad needs: a private bus, the reference server with its admin
// interface, its state directory with the generated configuration and entitlement manifests, and
// the daemon as a child process, ready once it says READY=1 on its notify socket.
#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "common/child_process.h"
#include "common/private_bus.h"
#include "common/server_world.h"
#include "devserver/dev_server.h"
#include "platform/value.h"

namespace service_test {

using zlkatest::ChildProcess;
using zlkatest::runToEnd;
using zlkatest::RunResult;

class Harness {
 public:
  // With `anyUser`, processes of every user may reach the bus and read the daemon's files.
  explicit Harness(bool anyUser = false);
  ~Harness();

  const std::filesystem::path& directory() const { return directory_.path(); }
  std::filesystem::path stateDirectory() const { return directory() / "state"; }
  std::filesystem::path configFile() const { return stateDirectory() / "zlkad.toml"; }
  const std::string& busAddress() const { return bus_.address(); }

  // A manifest that gives `executable` run by `uid` the entitlement value.
  void writeManifest(const std::string& name, const std::string& executable, const platform::Value& entitlementValue,
                     mode_t mode = 0644, uid_t uid = getuid());
  // A copy of zlkactl at a path of its own, so that it is a client of its own identity.
  std::string copyOfZlkactl(const std::string& name);

  // Starts zlkad on the private bus with the generated configuration, through `launcher` (a
  // command line that ends by running the rest of its arguments) when given; true once ready.
  bool startDaemon(const std::vector<std::string>& extraArguments = {}, const std::vector<std::string>& launcher = {});
  ChildProcess* daemon() { return daemon_.get(); }

  devserver::DevServer& server() { return *server_; }
  zlkatest::AdminClient admin() const { return {server_->port(), stateDirectory() / "ca.pem"}; }

 private:
  zlkatest::TempDir directory_;
  client_test::PrivateBus bus_;
  std::unique_ptr<devserver::DevServer> server_;
  std::unique_ptr<ChildProcess> daemon_;
  int notifySocket_ = -1;
};

// The token an accessory would hold: two DER items back to back.
platform::Data sampleToken();

}  // namespace service_test
