// Who may call, with the daemon confined as its unit confines it: its own unprivileged user, only
// the unit's capabilities, and /proc as the unit mounts it. The boundary is the caller's user id as
// the bus recorded it, which neither fork nor exec can change.
#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>

#include <fstream>
#include <map>
#include <sstream>

#include "client/zlka_client.h"
#include "service/daemon_harness.h"

using platform::Array;
using platform::Value;
using service_test::Harness;

namespace {

// Every value of every key of the unit file's [Service] section, in order.
std::multimap<std::string, std::string> unitSettings() {
  std::ifstream in(std::string(DIST_DIR) + "/zlkad.service");
  std::multimap<std::string, std::string> settings;
  for (std::string line; std::getline(in, line);)
    if (size_t eq = line.find('='); eq != std::string::npos && !line.starts_with('#'))
      settings.emplace(line.substr(0, eq), line.substr(eq + 1));
  return settings;
}

// "CAP_SYS_PTRACE CAP_NET_RAW" as setpriv wants it: "-all,+sys_ptrace,+net_raw".
std::string setprivCapabilities(const std::string& unitList) {
  std::string out = "-all";
  std::istringstream words(unitList);
  for (std::string cap; words >> cap;) {
    for (char& c : cap) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    out += ",+" + cap.substr(cap.starts_with("cap_") ? 4 : 0);
  }
  return out;
}

std::string only(const std::multimap<std::string, std::string>& settings, const std::string& key) {
  auto it = settings.find(key);
  return it == settings.end() ? "" : it->second;
}

// A command line that runs the rest of its arguments as `user` with the unit's capabilities,
// no new privileges, and /proc mounted the way the unit's ProtectProc, ProcSubset and
// ReadOnlyPaths ask.
std::vector<std::string> unitLauncher(const passwd& user) {
  auto unit = unitSettings();
  EXPECT_EQ(only(unit, "NoNewPrivileges"), "yes");
  std::string procOptions = "hidepid=" + only(unit, "ProtectProc") + ",subset=" + only(unit, "ProcSubset");
  std::string procMode = only(unit, "ReadOnlyPaths") == "/proc" ? "ro" : "rw";
  std::string ambient = setprivCapabilities(only(unit, "AmbientCapabilities"));
  return {"/usr/bin/unshare",
          "--mount",
          "--propagation",
          "private",
          "--",
          "/bin/sh",
          "-c",
          "mount -t proc -o " + procOptions + " proc /proc && mount -o remount,bind," + procMode + " /proc && exec \"$@\"",
          "sh",
          "/usr/bin/setpriv",
          "--reuid=" + std::to_string(user.pw_uid),
          "--regid=" + std::to_string(user.pw_gid),
          "--clear-groups",
          "--no-new-privs",
          "--inh-caps=" + ambient,
          "--ambient-caps=" + ambient,
          "--bounding-set=" + setprivCapabilities(only(unit, "CapabilityBoundingSet")),
          "--"};
}

std::string statusField(pid_t pid, const std::string& field) {
  std::ifstream in("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(in, line);)
    if (line.starts_with(field + ":")) return line.substr(field.size() + 1);
  return "";
}

class CallerIdentity : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    // The daemon runs as "nobody", the attacker as "daemon": users every Debian system has.
    daemonUser = getpwnam("nobody");
    attacker = getpwnam("daemon");
    if (geteuid() != 0 || !daemonUser || !attacker) GTEST_SKIP() << "needs root and the users nobody and daemon";
    harness = new Harness(/*anyUser=*/true);
    harness->writeManifest("self", std::filesystem::read_symlink("/proc/self/exe").string(), Value(Array{"token-auth"}), 0644, 0);
    harness->writeManifest("sleep", std::filesystem::canonical("/usr/bin/sleep").string(), Value(Array{"token-auth"}), 0644, 0);
    ASSERT_TRUE(harness->startDaemon({}, unitLauncher(*daemonUser))) << harness->daemon()->standardError();
  }
  static void TearDownTestSuite() {
    delete harness;
    harness = nullptr;
  }

  // borrow_identity as `uid`, exec'ing /usr/bin/sleep: the D-Bus error name it was answered with.
  static std::string borrowSleepAs(uid_t uid, gid_t gid) {
    service_test::ChildProcess borrower({"/usr/bin/setpriv", "--reuid=" + std::to_string(uid), "--regid=" + std::to_string(gid),
                                         "--clear-groups", BORROW_IDENTITY_PATH, harness->busAddress(), "/usr/bin/sleep", "60"},
                                        harness->directory());
    EXPECT_TRUE(borrower.waitExit(std::chrono::seconds(60)).has_value());
    std::string out = borrower.standardOutput();
    return out.substr(0, out.find('\n'));
  }

  static inline passwd* daemonUser = nullptr;
  static inline passwd* attacker = nullptr;
  static inline Harness* harness = nullptr;
};

}  // namespace

TEST_F(CallerIdentity, TheConfinedDaemonServesAnEntitledCallerOfAnotherUser) {
  pid_t daemon = harness->daemon()->pid();
  uid_t realUid = 0;
  std::istringstream(statusField(daemon, "Uid")) >> realUid;
  EXPECT_EQ(realUid, daemonUser->pw_uid);
  EXPECT_EQ(statusField(daemon, "CapEff"), "\t0000000000080000");  // CAP_SYS_PTRACE alone

  auto client = zlka_client::ZLKAClient::connect({.bus = harness->busAddress()});
  ASSERT_TRUE(client.ok());
  auto confirmation = client.value()->confirmActivation({.token = service_test::sampleToken(), .uuid = "U"});
  EXPECT_TRUE(confirmation.ok()) << confirmation.error().description() << "\n" << harness->daemon()->standardError();
}

TEST_F(CallerIdentity, AnotherUserCannotBorrowAnEntitledProgramByForkAndExec) {
  // Within the entitled user, the exec'd program's identity does count: the gate passes and the
  // empty call fails on its arguments. This shows the attempt reaches the gate as intended.
  EXPECT_EQ(borrowSleepAs(0, 0), "com.kestro.ZLKAuthentication.Error.InvalidParameter");
  EXPECT_EQ(borrowSleepAs(attacker->pw_uid, attacker->pw_gid), "com.kestro.ZLKAuthentication.Error.MissingEntitlement")
      << harness->daemon()->standardError();
}
