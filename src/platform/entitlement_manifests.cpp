#include "platform/entitlement_manifests.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <sstream>

#include "platform/json.h"
#include "platform/log.h"

namespace platform {

namespace {

std::optional<std::string> checkFile(int fd) {
  struct stat st {};
  if (fstat(fd, &st) != 0) return "cannot be examined";
  if (!S_ISREG(st.st_mode)) return "is not a regular file";
  if (st.st_uid != 0 && st.st_uid != geteuid()) return "is not owned by root or by the daemon's user";
  if (st.st_mode & (S_IWGRP | S_IWOTH)) return "is writable by group or others";
  return std::nullopt;
}

std::string readAll(int fd) {
  std::string out;
  char buf[4096];
  for (;;) {
    ssize_t n = ::read(fd, buf, sizeof buf);
    if (n <= 0) break;
    out.append(buf, static_cast<size_t>(n));
  }
  return out;
}

int openPidfd(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }

bool pidfdAlive(int pidfd) { return syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) == 0; }

}  // namespace

EntitlementManifests::EntitlementManifests(std::filesystem::path directory)
    : directory_(std::move(directory)), entries_(std::make_shared<const std::vector<Entry>>()) {}

size_t EntitlementManifests::reload() {
  std::vector<std::filesystem::path> files;
  std::error_code ec;
  for (const auto& item : std::filesystem::directory_iterator(directory_, ec))
    if (item.path().extension() == ".json") files.push_back(item.path());
  if (ec) log(LogLevel::Error, "Cannot read the entitlement directory %s: %s", directory_.string(), ec.message());
  std::sort(files.begin(), files.end());

  auto entries = std::make_shared<std::vector<Entry>>();
  for (const auto& file : files) {
    int fd = ::open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) {
      log(LogLevel::Error, "Ignoring entitlement manifest %s: cannot be opened", file.string());
      continue;
    }
    std::optional<std::string> problem = checkFile(fd);
    std::string text = problem ? std::string() : readAll(fd);
    ::close(fd);
    if (problem) {
      log(LogLevel::Error, "Ignoring entitlement manifest %s: it %s", file.string(), *problem);
      continue;
    }
    std::string error;
    std::optional<Value> parsed = json::parse(text, &error);
    const Value* executable = parsed ? parsed->find("executable") : nullptr;
    const Value* uid = parsed ? parsed->find("uid") : nullptr;
    const Value* entitlements = parsed ? parsed->find("entitlements") : nullptr;
    if (!parsed || !executable || !executable->string() || !executable->string()->starts_with("/") || !entitlements ||
        !entitlements->dictionary() || (uid && !(uid->integer() && *uid->integer() >= 0) && !uid->unsignedInteger())) {
      log(LogLevel::Error,
          "Ignoring entitlement manifest %s: expected {\"executable\": absolute path, \"uid\": optional number, "
          "\"entitlements\": object}%s%s",
          file.string(), error.empty() ? "" : ": ", error);
      continue;
    }
    Entry entry;
    // Compare against the resolved path the kernel reports for a running executable.
    std::error_code canonicalError;
    std::filesystem::path canonical = std::filesystem::canonical(*executable->string(), canonicalError);
    entry.executable = canonicalError ? *executable->string() : canonical.string();
    if (uid) entry.uid = static_cast<uid_t>(uid->integer() ? *uid->integer() : static_cast<int64_t>(*uid->unsignedInteger()));
    entry.entitlements = *entitlements->dictionary();
    entries->push_back(std::move(entry));
  }
  size_t count = entries->size();
  std::lock_guard lock(mutex_);
  entries_ = std::move(entries);
  return count;
}

std::optional<Value> EntitlementManifests::valueFor(const std::string& executable, uid_t uid, std::string_view entitlement) const {
  std::shared_ptr<const std::vector<Entry>> entries;
  {
    std::lock_guard lock(mutex_);
    entries = entries_;
  }
  std::optional<Value> value;
  for (const Entry& e : *entries) {
    if (e.executable != executable || (e.uid && *e.uid != uid)) continue;
    auto it = e.entitlements.find(entitlement);
    if (it != e.entitlements.end()) value = it->second;
  }
  return value;
}

std::optional<std::string> peerExecutable(const PeerCredentials& credentials) {
  if (credentials.pid <= 0) return std::nullopt;
  // Hold the process with a pidfd while reading, so that a recycled pid cannot slip in unnoticed.
  int ownPidfd = -1;
  int pidfd = credentials.pidfd;
  if (pidfd < 0) {
    ownPidfd = openPidfd(credentials.pid);
    if (ownPidfd < 0) return std::nullopt;
    pidfd = ownPidfd;
  }
  std::string proc = "/proc/" + std::to_string(credentials.pid);
  std::optional<std::string> result;
  char buf[4096];
  ssize_t n = ::readlink((proc + "/exe").c_str(), buf, sizeof buf - 1);
  struct stat st {};
  bool ownerMatches = ::stat(proc.c_str(), &st) == 0 && st.st_uid == credentials.uid;
  if (n > 0 && ownerMatches && pidfdAlive(pidfd)) {
    std::string path(buf, static_cast<size_t>(n));
    // A replaced or deleted binary is not the one a manifest names.
    if (!path.ends_with(" (deleted)")) result = std::move(path);
  }
  if (ownPidfd >= 0) ::close(ownPidfd);
  return result;
}

}  // namespace platform
