#include "platform/listener/entitlement_manifests.h"

#include <fcntl.h>
#include <poll.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <limits>

#include "platform/log/log.h"
#include "platform/values/json.h"

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

std::optional<uid_t> uidOfUser(const std::string& name) {
  passwd entry{};
  passwd* found = nullptr;
  std::array<char, 4096> buffer{};
  if (getpwnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &found) != 0 || !found) return std::nullopt;
  return found->pw_uid;
}

std::optional<uid_t> uidOfNumber(const Value& v) {
  // (uid_t)-1 means "no user" to the kernel, so it can never pin one.
  constexpr uint64_t kLargest = std::numeric_limits<uid_t>::max() - 1;
  if (const int64_t* i = v.integer(); i && *i >= 0 && static_cast<uint64_t>(*i) <= kLargest)
    return static_cast<uid_t>(*i);
  if (const uint64_t* u = v.unsignedInteger(); u && *u <= kLargest) return static_cast<uid_t>(*u);
  return std::nullopt;
}

// The process behind a pidfd is still running: its pidfd becomes readable when it exits. Unlike a
// signal 0 through the pidfd, polling needs no capability over the process.
bool stillRunning(int pidfd) {
  pollfd p{pidfd, POLLIN, 0};
  return ::poll(&p, 1, 0) == 0;
}

bool isManifestKey(const std::string& key) {
  return key == "uid" || key == "user" || key == "label" || key == "executable" || key == "entitlements";
}

// The user an entry pins, by number or by name; exactly one of the two.
Result<uid_t> pinnedUser(const Value& manifest) {
  const Value* uid = manifest.find("uid");
  const Value* user = manifest.find("user");
  if (!uid && !user) return Failure{"pins no user: an entry must give \"uid\" (a number) or \"user\" (a name)"};
  if (uid && user) return Failure{"gives both \"uid\" and \"user\": give one"};
  if (uid) {
    std::optional<uid_t> number = uidOfNumber(*uid);
    if (!number) return Failure{"has a \"uid\" that is not a user id"};
    return *number;
  }
  const std::string* name = user->string();
  if (!name || name->empty()) return Failure{"has a \"user\" that is not a user name"};
  std::optional<uid_t> resolved = uidOfUser(*name);
  if (!resolved) return Failure{"names an unknown user \"" + *name + "\""};
  return *resolved;
}

Result<std::optional<std::string>> pinnedLabel(const Value& manifest) {
  const Value* label = manifest.find("label");
  if (!label) return std::optional<std::string>();
  if (!label->string() || label->string()->empty()) return Failure{"has a \"label\" that is not a non-empty string"};
  return std::optional<std::string>(*label->string());
}

Result<std::optional<std::string>> pinnedExecutable(const Value& manifest) {
  const Value* executable = manifest.find("executable");
  if (!executable) return std::optional<std::string>();
  const std::string* path = executable->string();
  if (!path || !path->starts_with("/")) return Failure{"has an \"executable\" that is not an absolute path"};
  // Compare against the resolved path the kernel reports for a running executable.
  std::error_code ec;
  std::filesystem::path canonical = std::filesystem::canonical(*path, ec);
  return std::optional<std::string>(ec ? *path : canonical.string());
}

}  // namespace

Result<ManifestEntry> parseManifestEntry(std::string_view text) {
  Result<Value> parsed = json::parse(text);
  if (!parsed) return Failure{"does not parse: " + parsed.error()};
  const Dictionary* fields = parsed->dictionary();
  if (!fields) return Failure{"is not a JSON object"};
  // A misspelt key would silently widen the entry ("lable" pins no label), so it voids the entry.
  for (const auto& [key, value] : *fields)
    if (!isManifestKey(key)) return Failure{"has an unknown key \"" + key + "\""};

  ManifestEntry entry;
  Result<uid_t> uid = pinnedUser(*parsed);
  if (!uid) return Failure{uid.error()};
  entry.uid = *uid;
  Result<std::optional<std::string>> label = pinnedLabel(*parsed);
  if (!label) return Failure{label.error()};
  entry.label = *std::move(label);
  Result<std::optional<std::string>> executable = pinnedExecutable(*parsed);
  if (!executable) return Failure{executable.error()};
  entry.executable = *std::move(executable);
  const Value* entitlements = parsed->find("entitlements");
  if (!entitlements || !entitlements->dictionary()) return Failure{"has no \"entitlements\" object"};
  entry.entitlements = *entitlements->dictionary();
  return entry;
}

bool ManifestEntry::matches(const PeerIdentity& peer) const {
  return uid == peer.uid && (!label || label == peer.label) && (!executable || executable == peer.executable);
}

EntitlementManifests::EntitlementManifests(std::filesystem::path directory)
    : directory_(std::move(directory)), entries_(std::make_shared<const std::vector<ManifestEntry>>()) {}

size_t EntitlementManifests::reload() {
  std::vector<std::filesystem::path> files;
  std::error_code ec;
  for (const auto& item : std::filesystem::directory_iterator(directory_, ec))
    if (item.path().extension() == ".json") files.push_back(item.path());
  if (ec) log(LogLevel::Error, "Cannot read the entitlement directory %s: %s", directory_.string(), ec.message());
  std::sort(files.begin(), files.end());

  auto entries = std::make_shared<std::vector<ManifestEntry>>();
  for (const auto& file : files) {
    UniqueFd fd(::open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    std::optional<std::string> problem = fd ? checkFile(fd.get()) : "cannot be opened";
    if (!problem) {
      Result<ManifestEntry> entry = parseManifestEntry(readAll(fd.get()));
      if (entry) {
        entries->push_back(*std::move(entry));
        continue;
      }
      problem = entry.error();
    }
    log(LogLevel::Error, "Ignoring entitlement manifest %s: it %s", file.string(), *problem);
  }
  size_t count = entries->size();
  std::lock_guard lock(mutex_);
  entries_ = std::move(entries);
  return count;
}

std::optional<Value> EntitlementManifests::valueFor(const PeerIdentity& peer, std::string_view entitlement) const {
  std::shared_ptr<const std::vector<ManifestEntry>> entries;
  {
    std::lock_guard lock(mutex_);
    entries = entries_;
  }
  std::optional<Value> value;
  for (const ManifestEntry& e : *entries) {
    if (!e.matches(peer)) continue;
    auto it = e.entitlements.find(entitlement);
    if (it != e.entitlements.end()) value = it->second;
  }
  return value;
}

PeerIdentity peerIdentity(const PeerCredentials& credentials) {
  PeerIdentity identity{credentials.uid, credentials.pid, credentials.label, std::nullopt};
  if (credentials.pid <= 0) return identity;
  // Hold the process while reading, so that a recycled pid cannot slip in unnoticed. The bus's own
  // pidfd names the very process that connected; one opened now may name a later process of the
  // same pid, which the owner check below then confines to the recorded user.
  UniqueFd opened;
  int pidfd = credentials.pidfd.get();
  if (pidfd < 0) {
    opened.reset(static_cast<int>(syscall(SYS_pidfd_open, credentials.pid, 0)));
    if (!opened) return identity;
    pidfd = opened.get();
  }
  std::string proc = "/proc/" + std::to_string(credentials.pid);
  char buf[4096];
  ssize_t n = ::readlink((proc + "/exe").c_str(), buf, sizeof buf - 1);
  struct stat st {};
  bool ownerMatches = ::stat(proc.c_str(), &st) == 0 && st.st_uid == credentials.uid;
  if (n > 0 && ownerMatches && stillRunning(pidfd)) {
    std::string path(buf, static_cast<size_t>(n));
    // A replaced or deleted binary is not the one a manifest names.
    if (!path.ends_with(" (deleted)")) identity.executable = std::move(path);
  }
  return identity;
}

}  // namespace platform
