// What an end-to-end test of zlkad needs: a private bus, the reference server, a state directory
// with its generated configuration and entitlement manifests, the daemon as a child process
// (ready when it says READY=1 on its notify socket), and copies of zlkactl that stand for clients
// with other identities.
#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "common/private_bus.h"
#include "devserver/dev_server.h"
#include "platform/value.h"

namespace service_test {

// A child process with stdout and stderr captured to files.
class ChildProcess {
 public:
  ChildProcess(const std::vector<std::string>& argv, const std::filesystem::path& outputDirectory,
               const std::vector<std::string>& extraEnvironment = {});
  ~ChildProcess();
  pid_t pid() const { return pid_; }
  // The exit status, or nullopt when the child is still running at the deadline.
  std::optional<int> waitExit(std::chrono::milliseconds deadline);
  void signal(int sig) const;
  std::string standardOutput() const;
  std::string standardError() const;

 private:
  pid_t pid_ = -1;
  int pidfd_ = -1;
  std::optional<int> status_;
  std::filesystem::path out_, err_;
};

// The result of running a program to its end.
struct RunResult {
  int status = -1;
  std::string out, err;
};
RunResult runToEnd(const std::vector<std::string>& argv, const std::filesystem::path& outputDirectory);

class Harness {
 public:
  // With `anyUser`, processes of every user may reach the bus and read the daemon's files.
  explicit Harness(bool anyUser = false);
  ~Harness();

  const std::filesystem::path& directory() const { return directory_; }
  std::filesystem::path stateDirectory() const { return directory_ / "state"; }
  std::filesystem::path configFile() const { return stateDirectory() / "zlkad.toml"; }
  std::filesystem::path entitlementsDirectory() const { return stateDirectory() / "entitlements.d"; }
  const std::string& busAddress() const { return bus_.address(); }
  devserver::DevServer& server() { return *server_; }

  // Writes a manifest file that gives `executable` run by `uid` the entitlement value.
  void writeManifest(const std::string& name, const std::string& executable, const platform::Value& entitlementValue,
                     mode_t mode = 0644, uid_t uid = getuid());
  // A copy of zlkactl at its own path, so that it is a client of its own identity.
  std::string copyOfZlkactl(const std::string& name);

  // Starts zlkad on the private bus with the generated configuration, through `launcher` (a
  // command line that ends by running the rest of its arguments) when given; true once it is ready.
  bool startDaemon(const std::vector<std::string>& extraArguments = {}, const std::vector<std::string>& launcher = {});
  ChildProcess* daemon() { return daemon_.get(); }

  // Admin requests to the server.
  void setFault(const std::string& jsonBody);
  void clearFaults();
  platform::Value stats();

 private:
  std::filesystem::path directory_;
  client_test::PrivateBus bus_;
  std::unique_ptr<devserver::DevServer> server_;
  std::unique_ptr<ChildProcess> daemon_;
  int notifySocket_ = -1;
};

// The token an accessory would hold: two DER items back to back.
platform::Data sampleToken();

}  // namespace service_test
