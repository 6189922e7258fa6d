// What an end-to-end test of zlkad needs: a private bus, the reference server with its admin
// interface and state directory (configuration, entitlement manifests), and the daemon as a child
// process, ready once it says READY=1 on its notify socket.
#pragma once

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "client/zlka_client.h"
#include "common/child_process.h"
#include "common/server_world.h"
#include "devserver/dev_server.h"
#include "platform/bus/handles.h"

namespace service_test {

using zlka_client::ZLKAClient;

class Harness {
 public:
  // With `anyUser`, processes of every user may reach the bus and read the daemon's files.
  explicit Harness(bool anyUser = false);
  ~Harness();

  std::filesystem::path directory() const { return directory_.path(); }
  std::filesystem::path stateDirectory() const {
    return directory() / "state";
  }  // zlkad.toml, ca.pem, entitlements.d, defaults
  const std::string& busAddress() const { return bus_.address(); }
  devserver::DevServer& server() { return *server_; }
  zlkatest::AdminClient admin() const { return zlkatest::AdminClient(*server_); }
  zlkatest::ChildProcess* daemon() { return daemon_.get(); }

  // A manifest that gives `executable`, run by this process's user, the entitlement value.
  void writeManifest(const std::string& name, const std::string& executable,
                     const platform::Value& value = platform::Array{"token-auth"}) const;
  void entitleSelf() const { writeManifest("self", std::filesystem::read_symlink("/proc/self/exe").string()); }
  // Starts zlkad on the private bus, through `launcher` (a command line that ends by running the
  // rest of its arguments) when given; true once it is ready.
  bool startDaemon(const std::vector<std::string>& extraArguments = {}, const std::vector<std::string>& launcher = {});
  std::unique_ptr<ZLKAClient> connect() const;

 private:
  zlkatest::TempDir directory_;
  zlkatest::PrivateBus bus_;
  std::unique_ptr<devserver::DevServer> server_;
  std::unique_ptr<zlkatest::ChildProcess> daemon_;
  platform::UniqueFd notifySocket_;
};

// The token an accessory would hold: two DER items back to back.
platform::Data sampleToken();

// "ok", or "domain code: description".
template <class T>
std::string outcome(const zlka_client::Result<T>& r) {
  return r.ok() ? "ok"
                : r.error().domain() + " " + std::to_string(r.error().code()) + ": " + r.error().localizedDescription();
}

}  // namespace service_test
