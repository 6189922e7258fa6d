#include "common/child_process.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <sstream>
#include <string_view>
#include <thread>

extern char** environ;

namespace zlkatest {

std::string readFile(const std::filesystem::path& path) {
  std::ostringstream text;
  text << std::ifstream(path, std::ios::binary).rdbuf();
  return text.str();
}

TempDir::TempDir() {
  char pattern[] = "/tmp/zlka-test-XXXXXX";
  if (::mkdtemp(pattern)) path_ = pattern;
}

TempDir::~TempDir() {
  std::error_code ignored;
  if (!path_.empty()) std::filesystem::remove_all(path_, ignored);
}

ChildProcess::ChildProcess(const std::vector<std::string>& argv, const std::filesystem::path& outputDirectory,
                           const std::vector<std::string>& extraEnvironment) {
  static std::atomic<int> counter{0};
  const std::string tag = "child-" + std::to_string(getpid()) + "-" + std::to_string(++counter);
  out_ = outputDirectory / (tag + ".out");
  err_ = outputDirectory / (tag + ".err");
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, out_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, err_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  // A daemon must start with no signal blocked, whatever the test runner's threads block.
  posix_spawnattr_t attributes;
  posix_spawnattr_init(&attributes);
  sigset_t none;
  sigemptyset(&none);
  posix_spawnattr_setsigmask(&attributes, &none);
  posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK);
  std::vector<std::string> env;
  for (char** e = environ; *e; ++e)
    if (!std::string_view(*e).starts_with("NOTIFY_SOCKET=")) env.emplace_back(*e);
  env.insert(env.end(), extraEnvironment.begin(), extraEnvironment.end());
  std::vector<char*> args, envp;
  for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  for (auto& e : env) envp.push_back(e.data());
  args.push_back(nullptr);
  envp.push_back(nullptr);
  if (posix_spawn(&pid_, args[0], &actions, &attributes, args.data(), envp.data()) != 0) pid_ = -1;
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attributes);
  if (pid_ > 0) pidfd_ = static_cast<int>(syscall(SYS_pidfd_open, pid_, 0));
}

ChildProcess::~ChildProcess() {
  if (pid_ > 0 && !status_) {
    ::kill(pid_, SIGKILL);
    waitExit(std::chrono::seconds(10));
  }
  if (pidfd_ >= 0) ::close(pidfd_);
}

std::optional<int> ChildProcess::waitExit(std::chrono::milliseconds deadline) {
  if (status_ || pid_ <= 0) return pid_ <= 0 ? std::optional<int>(-1) : status_;
  pollfd p{pidfd_, POLLIN, 0};
  int raw = 0;
  if (::poll(&p, 1, static_cast<int>(deadline.count())) <= 0 || ::waitpid(pid_, &raw, 0) != pid_) return std::nullopt;
  status_ = WIFEXITED(raw) ? WEXITSTATUS(raw) : 128 + WTERMSIG(raw);
  return status_;
}

void ChildProcess::signal(int sig) const {
  if (pid_ > 0 && !status_) ::kill(pid_, sig);
}

std::string ChildProcess::standardOutput() const { return readFile(out_); }
std::string ChildProcess::standardError() const { return readFile(err_); }

RunResult runToEnd(const std::vector<std::string>& argv, const std::filesystem::path& outputDirectory) {
  ChildProcess child(argv, outputDirectory);
  const int status = child.waitExit(std::chrono::minutes(2)).value_or(-1);
  return {status, child.standardOutput(), child.standardError()};
}

PrivateBus::PrivateBus(bool anyUser) {
  if (anyUser) std::filesystem::permissions(directory_.path(), std::filesystem::perms(0755));
  const std::filesystem::path config = directory_.path() / "bus.conf";
  std::ofstream(config)
      << "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
         " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
         "<busconfig><type>session</type><auth>EXTERNAL</auth><listen>unix:path="
      << (directory_.path() / "socket").string()
      << "</listen>\n"
         // Room for the benchmark's thousand idle peers.
         "<limit name=\"max_completed_connections\">4096</limit><limit name=\"max_connections_per_user\">4096</limit>\n"
         "<policy context=\"default\">"
      << (anyUser ? "<allow user=\"*\"/>" : "")
      << "<allow send_destination=\"*\" eavesdrop=\"true\"/><allow eavesdrop=\"true\"/><allow own=\"*\"/></policy>\n"
         "</busconfig>\n";
  // The address is printed once the daemon listens.
  daemon_ = std::make_unique<ChildProcess>(
      std::vector<std::string>{"/usr/bin/dbus-daemon", "--config-file=" + config.string(), "--nofork",
                               "--print-address=1"},
      directory_.path());
  std::string out;
  for (int i = 0; i < 3000 && (out = daemon_->standardOutput()).find('\n') == std::string::npos &&
                  !daemon_->waitExit(std::chrono::milliseconds(0));
       ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  if (out.find('\n') == std::string::npos)
    ADD_FAILURE() << "dbus-daemon printed no address: " << daemon_->standardError();
  else
    address_ = out.substr(0, out.find('\n'));
}

}  // namespace zlkatest
