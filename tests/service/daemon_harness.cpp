#include "service/daemon_harness.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <fstream>

#include "platform/values/json.h"

namespace service_test {

Harness::Harness(bool anyUser) : bus_(anyUser) {
  devserver::DevServerOptions options;
  options.stateDir = stateDirectory();
  options.admin = true;
  server_ = std::make_unique<devserver::DevServer>(options);
  if (auto error = server_->start()) ADD_FAILURE() << "zlka-devserver did not start: " << *error;
  if (anyUser)
    for (const auto& dir : {directory(), stateDirectory(), stateDirectory() / "entitlements.d"})
      std::filesystem::permissions(dir, std::filesystem::perms(0755));
}

Harness::~Harness() {
  if (daemon_)
    daemon_->signal(SIGTERM), daemon_->waitExit(std::chrono::seconds(30));  // a graceful end keeps its coverage data
}

void Harness::writeManifest(const std::string& name, const std::string& executable,
                            const platform::Value& value) const {
  platform::Value manifest(
      platform::Dictionary{{"uid", getuid()},
                           {"executable", executable},
                           {"entitlements", platform::Dictionary{{"com.kestro.ZLKAuthentication", value}}}});
  std::ofstream(stateDirectory() / "entitlements.d" / (name + ".json")) << *platform::json::serialize(manifest);
}

bool Harness::startDaemon(const std::vector<std::string>& extraArguments, const std::vector<std::string>& launcher) {
  auto socketPath = directory() / "notify.sock";
  notifySocket_.reset(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof address.sun_path, "%s", socketPath.c_str());
  if (::bind(notifySocket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return false;
  std::filesystem::permissions(socketPath, std::filesystem::perms(0666));  // a daemon of any user may notify
  std::vector<std::string> argv = launcher;
  argv.insert(argv.end(), {ZLKAD_PATH, "--config", (stateDirectory() / "zlkad.toml").string(), "--bus", busAddress(),
                           "--log", "stderr", "--log-level", "info"});
  argv.insert(argv.end(), extraArguments.begin(), extraArguments.end());
  daemon_ = std::make_unique<zlkatest::ChildProcess>(argv, directory(),
                                                     std::vector<std::string>{"NOTIFY_SOCKET=" + socketPath.string()});
  // READY=1 comes once the daemon owns its name; a daemon that dies first never sends it.
  pollfd p{notifySocket_.get(), POLLIN, 0};
  char buffer[512];
  for (ssize_t n; ::poll(&p, 1, 30000) > 0 && (n = ::recv(notifySocket_.get(), buffer, sizeof buffer, 0)) > 0;)
    if (std::string_view(buffer, static_cast<size_t>(n)).find("READY=1") != std::string_view::npos) return true;
  return false;
}

std::unique_ptr<ZLKAClient> Harness::connect() const {
  auto made = ZLKAClient::connect({.bus = busAddress()});
  return made.ok() ? std::move(made).value() : nullptr;
}

platform::Data sampleToken() {
  return platform::Data(
      std::vector<uint8_t>{0x30, 0x06, 0x04, 0x01, 0x5A, 0x02, 0x01, 0x01, 0x04, 0x03, 0x01, 0x02, 0x03});
}

}  // namespace service_test
