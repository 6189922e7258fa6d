// Programs run by the tests: the daemon, zlkactl, zlka-devserver, dbus-daemon. Standard input is
// /dev/null and standard output and error go to files in a directory the test keeps, so that a
// child never blocks on a full pipe and its output can be read at any time.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace zlkatest {

// A fresh directory under /tmp, removed with everything in it at destruction.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::filesystem::path& path() const { return path_; }

 private:
  std::filesystem::path path_;
};

class ChildProcess {
 public:
  // argv[0] is a path. NOTIFY_SOCKET is not inherited; `extraEnvironment` ("NAME=value") is added.
  ChildProcess(const std::vector<std::string>& argv, const std::filesystem::path& outputDirectory,
               const std::vector<std::string>& extraEnvironment = {});
  ~ChildProcess();  // kills a child still running
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  pid_t pid() const { return pid_; }
  // The exit status (128 + signal number for a signal), or nullopt while it runs past `deadline`.
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

struct RunResult {
  int status = -1;  // -1 when it did not end within two minutes
  std::string out, err;
};
RunResult runToEnd(const std::vector<std::string>& argv, const std::filesystem::path& outputDirectory);
std::string readFile(const std::filesystem::path& path);  // "" when it cannot be read

// A private dbus-daemon for one test, from a configuration that lets anyone own any name; with
// `anyUser`, processes of every user may connect, as on the system bus. Fails the current test
// when it does not start.
class PrivateBus {
 public:
  explicit PrivateBus(bool anyUser = false);
  bool running() const { return !address_.empty(); }
  const std::string& address() const { return address_; }  // "unix:path=...,guid=..."

 private:
  TempDir directory_;
  std::unique_ptr<ChildProcess> daemon_;
  std::string address_;
};

}  // namespace zlkatest
