// Entitlement manifests: *.json files in a directory, one entry each:
//   {"user": "accessoryd", "label": "accessoryd", "executable": "/usr/libexec/accessoryd",
//    "entitlements": {"key": value, ...}}
//
// The security boundary is what the bus recorded when the peer connected and neither fork nor exec
// can change: its user id and, where the system has an LSM, its security label. So every entry
// pins a user ("uid" as a number, or "user" as a name resolved when the manifest is read); "label"
// and "executable" are optional refinements inside that user. An entry that pins no user, names an
// unknown user, or does not parse is ignored with an error line naming the file and the reason, as
// is a file that is not owned by root or by this process's user, or that group or others may
// write. Entries that match the same peer merge in file-name order.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/bus/handles.h"
#include "platform/values/result.h"
#include "platform/values/value.h"

namespace platform {

// What the bus recorded about a peer when it connected.
struct PeerCredentials {
  uid_t uid = static_cast<uid_t>(-1);
  pid_t pid = 0;
  std::optional<std::string> label;  // the LSM label, trailing NUL removed; none without an LSM
  UniqueFd pidfd;                    // the connecting process, when the bus offers it
};

// Who a peer is, established once from its credentials.
struct PeerIdentity {
  uid_t uid = static_cast<uid_t>(-1);
  pid_t pid = 0;
  std::optional<std::string> label;
  std::optional<std::string> executable;  // none when it cannot be established with certainty
};

// One manifest entry: the peers it matches and the entitlements it gives them.
struct ManifestEntry {
  uid_t uid = static_cast<uid_t>(-1);
  std::optional<std::string> label;
  std::optional<std::string> executable;  // canonical path when the file exists
  Dictionary entitlements;

  // matches is true when the peer runs as the entry's user and shows every refinement the entry
  // pins; a peer without a label or a known executable never matches an entry that pins one.
  bool matches(const PeerIdentity& peer) const;
};

// parseManifestEntry reads one manifest's text, resolving "user" through the user database. It
// fails, with the reason, on anything but an object of known keys that pins exactly one user,
// has at most a non-empty "label" and an absolute "executable", and an "entitlements" object.
Result<ManifestEntry> parseManifestEntry(std::string_view text);

class EntitlementManifests {
 public:
  // EntitlementManifests reads `directory` only on reload(); until then no entry is in force.
  explicit EntitlementManifests(std::filesystem::path directory);
  // directory is the manifest directory given, borrowed.
  const std::filesystem::path& directory() const { return directory_; }

  // reload reads the directory again (start-up and SIGHUP), logging every file it ignores, and
  // returns the number of entries now in force; an unreadable directory leaves none in force.
  size_t reload();
  // valueFor answers the entitlement's value for a peer from the entries that match it, or nullopt
  // when no matching entry holds the entitlement.
  std::optional<Value> valueFor(const PeerIdentity& peer, std::string_view entitlement) const;

 private:
  std::filesystem::path directory_;
  mutable std::mutex mutex_;
  std::shared_ptr<const std::vector<ManifestEntry>> entries_;
};

// peerIdentity establishes a peer's identity from its credentials. The executable is read from
// /proc and kept only when the process is provably the one the bus recorded (held alive through
// a pidfd, and owned by the recorded user); otherwise the identity has no executable, so entries
// that pin one do not match. Never fails as a whole: user and label come from the bus.
PeerIdentity peerIdentity(const PeerCredentials& credentials);

}  // namespace platform
