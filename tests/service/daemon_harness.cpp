#include "service/daemon_harness.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>


#include <httplib.h>

#include <fstream>
#include <sstream>

#include "platform/json.h"

extern char** environ;

namespace service_test {

namespace {

std::string readFile(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

std::filesystem::path uniqueDirectory() {
  char templ[] = "/tmp/zlka-service-test.XXXXXX";
  char* made = mkdtemp(templ);
  return made ? std::filesystem::path(made) : std::filesystem::path();
}

}  // namespace

ChildProcess::ChildProcess(const std::vector<std::string>& argv, const std::filesystem::path& outputDirectory,
                           const std::vector<std::string>& extraEnvironment) {
  static int counter = 0;
  std::string tag = std::to_string(getpid()) + "-" + std::to_string(++counter);
  out_ = outputDirectory / ("child-" + tag + ".out");
  err_ = outputDirectory / ("child-" + tag + ".err");
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, out_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, err_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
  // The test runner blocks no signals, but be explicit: the daemon must start with a clean mask.
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
  args.push_back(nullptr);
  for (auto& e : env) envp.push_back(e.data());
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
  if (status_) return status_;
  if (pid_ <= 0) return -1;
  pollfd p{pidfd_, POLLIN, 0};
  if (::poll(&p, 1, static_cast<int>(deadline.count())) <= 0) return std::nullopt;
  int raw = 0;
  if (::waitpid(pid_, &raw, 0) != pid_) return std::nullopt;
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
  RunResult r;
  r.status = child.waitExit(std::chrono::seconds(120)).value_or(-1);
  r.out = child.standardOutput();
  r.err = child.standardError();
  return r;
}

Harness::Harness(bool anyUser) : directory_(uniqueDirectory()), bus_(anyUser) {
  devserver::DevServerOptions options;
  options.stateDir = stateDirectory();
  options.admin = true;
  server_ = std::make_unique<devserver::DevServer>(options);
  if (auto error = server_->start()) ADD_FAILURE() << "zlka-devserver did not start: " << *error;
  std::filesystem::create_directories(entitlementsDirectory());
  if (anyUser)
    for (const auto& dir : {directory_, stateDirectory(), entitlementsDirectory()})
      std::filesystem::permissions(dir, std::filesystem::perms(0755));
}

Harness::~Harness() {
  if (daemon_) {
    daemon_->signal(SIGTERM);
    daemon_->waitExit(std::chrono::seconds(30));
    daemon_.reset();
  }
  server_->stop();
  if (notifySocket_ >= 0) ::close(notifySocket_);
  std::error_code ec;
  std::filesystem::remove_all(directory_, ec);
}

void Harness::writeManifest(const std::string& name, const std::string& executable, const platform::Value& value, mode_t mode,
                            uid_t uid) {
  platform::Value manifest(platform::Dictionary{{"uid", uid},
                                                {"executable", executable},
                                                {"entitlements", platform::Dictionary{{"com.kestro.ZLKAuthentication", value}}}});
  auto path = entitlementsDirectory() / (name + ".json");
  std::ofstream(path) << *platform::json::serialize(manifest);
  std::filesystem::permissions(path, static_cast<std::filesystem::perms>(mode));
}

std::string Harness::copyOfZlkactl(const std::string& name) {
  auto dir = directory_ / "clients" / name;
  std::filesystem::create_directories(dir);
  auto path = dir / "zlkactl";
  std::filesystem::copy_file(ZLKACTL_PATH, path, std::filesystem::copy_options::overwrite_existing);
  return path.string();
}

bool Harness::startDaemon(const std::vector<std::string>& extraArguments, const std::vector<std::string>& launcher) {
  auto socketPath = directory_ / "notify.sock";
  notifySocket_ = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof address.sun_path, "%s", socketPath.c_str());
  if (::bind(notifySocket_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return false;
  std::filesystem::permissions(socketPath, std::filesystem::perms(0666));  // a daemon of any user may notify
  std::vector<std::string> argv = launcher;
  std::vector<std::string> daemon = {ZLKAD_PATH, "--config", configFile().string(), "--bus", busAddress(), "--log", "stderr",
                                   "--log-level", "info"};
  daemon.insert(daemon.end(), extraArguments.begin(), extraArguments.end());
  argv.insert(argv.end(), daemon.begin(), daemon.end());
  daemon_ = std::make_unique<ChildProcess>(argv, directory_, std::vector<std::string>{"NOTIFY_SOCKET=" + socketPath.string()});
  // READY=1 arrives once the daemon owns its name; a daemon that dies first never sends it.
  pollfd p{notifySocket_, POLLIN, 0};
  while (::poll(&p, 1, 30000) > 0) {
    char buffer[512];
    ssize_t n = ::recv(notifySocket_, buffer, sizeof buffer - 1, 0);
    if (n <= 0) break;
    if (std::string_view(buffer, static_cast<size_t>(n)).find("READY=1") != std::string_view::npos) return true;
  }
  return false;
}

namespace {
std::unique_ptr<httplib::SSLClient> adminClient(devserver::DevServer& server, const std::filesystem::path& stateDir) {
  auto client = std::make_unique<httplib::SSLClient>("127.0.0.1", server.port());
  client->set_ca_cert_path((stateDir / "ca.pem").c_str());
  client->enable_server_certificate_verification(true);
  return client;
}
}  // namespace

void Harness::setFault(const std::string& jsonBody) {
  auto result = adminClient(*server_, stateDirectory())->Post("/_admin/faults", jsonBody, "application/json");
  ASSERT_TRUE(result && result->status == 200) << "fault not set: " << jsonBody;
}

void Harness::clearFaults() {
  auto result = adminClient(*server_, stateDirectory())->Delete("/_admin/faults");
  ASSERT_TRUE(result && result->status / 100 == 2);
}

platform::Value Harness::stats() {
  auto result = adminClient(*server_, stateDirectory())->Get("/_admin/stats");
  if (!result || result->status != 200) return platform::Value();
  return platform::json::parse(result->body).value_or(platform::Value());
}

platform::Data sampleToken() {
  std::vector<uint8_t> token = {0x30, 0x06, 0x04, 0x01, 0x5A, 0x02, 0x01, 0x01, 0x04, 0x03, 0x01, 0x02, 0x03};
  return platform::Data(std::move(token));
}

}  // namespace service_test
