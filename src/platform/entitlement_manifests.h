// Entitlement manifests: *.json files in a directory, each
//   {"executable": "/usr/libexec/accessoryd", "uid": 0, "entitlements": {"key": value, ...}}
// ("uid" optional: an entry that pins it matches no other uid). A file that is not owned by root
// or by this process's user, or that group or others may write, is ignored with an error line, as
// is one that does not parse. Entries for the same executable merge in file-name order.
//
// Peer identity: the executable of a peer process is read from /proc/<pid>/exe and trusted only
// when the process is provably the one the bus recorded (alive through a pidfd, and owned by the
// uid the bus recorded). Anything uncertain gives no identity, hence no entitlements.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value.h"

namespace platform {

struct PeerCredentials {
  uid_t uid = static_cast<uid_t>(-1);
  pid_t pid = 0;
  int pidfd = -1;  // from the bus when it offers one; not owned
};

class EntitlementManifests {
 public:
  explicit EntitlementManifests(std::filesystem::path directory);
  const std::filesystem::path& directory() const { return directory_; }

  // Reads the directory again (start-up and SIGHUP); returns the number of entries in force.
  size_t reload();
  std::optional<Value> valueFor(const std::string& executable, uid_t uid, std::string_view entitlement) const;

 private:
  struct Entry {
    std::string executable;
    std::optional<uid_t> uid;
    Dictionary entitlements;
  };
  std::filesystem::path directory_;
  mutable std::mutex mutex_;
  std::shared_ptr<const std::vector<Entry>> entries_;
};

// The peer's executable path, or nullopt when it cannot be established with certainty.
std::optional<std::string> peerExecutable(const PeerCredentials& credentials);

}  // namespace platform
