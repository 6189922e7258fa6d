// Who a manifest entry admits: the user the bus recorded is the boundary; label and executable
// only narrow it, and anything that would silently widen an entry voids it.
#include "platform/listener/entitlement_manifests.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>

#include "common/child_process.h"
#include "common/log_capture.h"

using platform::ManifestEntry;
using platform::PeerIdentity;
using platform::Value;

namespace {

constexpr char kGrant[] = R"("entitlements": {"com.kestro.ZLKAuthentication": ["token-auth"]})";

std::string entry(const std::string& fields) { return "{" + fields + (fields.empty() ? "" : ", ") + kGrant + "}"; }

}  // namespace

TEST(ManifestEntry, EveryEntryPinsExactlyOneUserAndNothingUnknown) {
  // clang-format off
  const std::tuple<const char*, std::string, const char*> rows[] = {  // name, entry, the refusal (null: accepted)
      {"uid", entry(R"("uid": 0)"), nullptr},
      {"user name", entry(R"("user": "root")"), nullptr},
      {"every refinement", entry(R"("uid": 7, "label": "accessoryd", "executable": "/usr/bin/env")"), nullptr},
      {"no user", entry(R"("executable": "/usr/bin/env")"), "pins no user"},
      {"both uid and user", entry(R"("uid": 0, "user": "root")"), "gives both"},
      {"unknown user", entry(R"("user": "no-such-user-zlka")"), "names an unknown user \"no-such-user-zlka\""},
      {"negative uid", entry(R"("uid": -1)"), "not a user id"},
      {"uid -1 as unsigned", entry(R"("uid": 4294967295)"), "not a user id"},  // the kernel's "no user"
      {"uid as text", entry(R"("uid": "0")"), "not a user id"},
      {"empty label", entry(R"("uid": 0, "label": "")"), "\"label\""},
      {"relative executable", entry(R"("uid": 0, "executable": "bin/env")"), "\"executable\""},
      {"misspelt refinement", entry(R"("uid": 0, "lable": "x")"), "unknown key \"lable\""},  // would widen it
      {"no entitlements", R"({"uid": 0})", "no \"entitlements\""},
      {"array", "[]", "not a JSON object"},
      {"broken JSON", "{\"uid\": ", "does not parse"},
  };
  // clang-format on
  for (const auto& [name, text, refusal] : rows) {
    platform::Result<ManifestEntry> parsed = platform::parseManifestEntry(text);
    ASSERT_EQ(parsed.ok(), !refusal) << name << ": " << (parsed ? "" : parsed.error());
    EXPECT_TRUE(!refusal || parsed.error().find(refusal) != std::string::npos) << name << ": " << parsed.error();
  }
  EXPECT_EQ(platform::parseManifestEntry(entry(R"("user": "root")"))->uid, 0u);
}

TEST(ManifestEntry, RefinementsOnlyNarrowTheUser) {
  const PeerIdentity plain{100, 1, std::nullopt, "/usr/libexec/accessoryd"};
  const PeerIdentity labelled{100, 1, "accessoryd", "/usr/libexec/accessoryd"};
  // clang-format off
  const std::tuple<const char*, std::optional<std::string>, std::optional<std::string>, PeerIdentity, bool> rows[] = {
      // name, the entry's label and executable (uid 100), the peer, whether the entry admits it
      {"same user", {}, {}, plain, true},
      {"other user", {}, {}, PeerIdentity{101, 1, "accessoryd", "/usr/libexec/accessoryd"}, false},
      {"label equal", "accessoryd", {}, labelled, true},
      {"label differs", "accessoryd", {}, PeerIdentity{100, 1, "accessoryd_t", std::nullopt}, false},
      {"label is a prefix", "accessory", {}, labelled, false},
      {"peer has no label", "accessoryd", {}, plain, false},  // no LSM: never matches a pinned label
      {"entry pins no label", {}, {}, labelled, true},
      {"executable equal", {}, "/usr/libexec/accessoryd", plain, true},
      {"executable differs", {}, "/usr/libexec/other", plain, false},
      {"executable unknown", {}, "/usr/libexec/accessoryd", PeerIdentity{100, 1, std::nullopt, std::nullopt}, false},
  };
  // clang-format on
  for (const auto& [name, label, executable, peer, matches] : rows)
    EXPECT_EQ((ManifestEntry{100, label, executable, {}}.matches(peer)), matches) << name;
}

TEST(EntitlementManifests, LaterFilesWinAndIgnoredFilesAreNamedWithTheirReason) {
  const zlkatest::TempDir temp;
  const std::filesystem::path& dir = temp.path();
  const std::string me = R"({"uid": )" + std::to_string(getuid()) + R"(, "entitlements": )";
  // clang-format off
  const std::tuple<const char*, std::string, mode_t> files[] = {
      {"10-first.json", me + R"({"k": 1, "only-first": true}})", 0644}, {"20-second.json", me + R"({"k": 2}})", 0644},
      {"30-loose.json", me + R"({"k": 3}})", 0664}, {"40-anyone.json", R"({"executable": "/usr/bin/env", "entitlements": {"k": 4}})", 0644},
      {"50-other-user.json", R"({"uid": )" + std::to_string(getuid() + 1) + R"(, "entitlements": {"k": 5}})", 0644},
      {"notes.txt", "not a manifest", 0644}};
  // clang-format on
  for (const auto& [name, text, mode] : files) {
    std::ofstream(dir / name) << text;
    chmod((dir / name).c_str(), mode);
  }
  zlkatest::LogCapture log;
  platform::EntitlementManifests manifests(dir);
  EXPECT_EQ(manifests.reload(), 3u);
  PeerIdentity peer{getuid(), getpid(), std::nullopt, std::nullopt};
  EXPECT_EQ(manifests.valueFor(peer, "k"), Value(2));
  EXPECT_EQ(manifests.valueFor(peer, "only-first"), Value(true));
  EXPECT_EQ(manifests.valueFor(peer, "absent"), std::nullopt);
  const std::string expected[] = {
      "Ignoring entitlement manifest " + (dir / "30-loose.json").string() + ": it is writable by group or others",
      "Ignoring entitlement manifest " + (dir / "40-anyone.json").string() + ": it pins no user",
  };
  const auto lines = log.entries();
  ASSERT_EQ(lines.size(), 2u) << log.dump();
  for (size_t i = 0; i < 2; ++i) EXPECT_TRUE(lines[i].message.starts_with(expected[i])) << lines[i].message;
}

TEST(PeerIdentity, TheExecutableIsReadOnlyForTheRecordedUser) {
  platform::PeerCredentials self{.uid = getuid(), .pid = getpid(), .label = {}, .pidfd = {}};
  EXPECT_EQ(platform::peerIdentity(self).executable, std::filesystem::read_symlink("/proc/self/exe").string());
  // A pid the bus recorded for another user (a recycled pid, or a setuid exec) shows no executable.
  self.uid = getuid() + 1;
  PeerIdentity other = platform::peerIdentity(self);
  EXPECT_EQ(std::tuple(other.uid, other.executable), std::tuple(getuid() + 1, std::nullopt));
}
