// The daemon confined as its unit confines it (its own unprivileged user, only the unit's
// capabilities, /proc as the unit mounts it), and under a task limit. Callers are told apart by the
// user id the bus recorded for them, which neither fork nor exec can change. Both need root.
#include <gtest/gtest.h>
#include <pwd.h>
#include <signal.h>

#include <algorithm>
#include <fstream>
#include <future>
#include <regex>
#include <sstream>
#include <thread>

#include "service/daemon_harness.h"

namespace service_test {
namespace {

// What follows `prefix` on the first line of `file` that starts with it.
std::string lineAfter(const std::string& file, const std::string& prefix) {
  std::ifstream in(file);
  for (std::string line; std::getline(in, line);)
    if (line.starts_with(prefix)) return line.substr(prefix.size());
  return "";
}
std::string unitSetting(const std::string& key) {
  return lineAfter(std::string(DIST_DIR) + "/zlkad.service", key + "=");
}

// "CAP_SYS_PTRACE CAP_NET_RAW" as setpriv wants it: "-all,+sys_ptrace,+net_raw".
std::string setprivCapabilities(const std::string& key) {
  std::string caps = std::regex_replace(unitSetting(key), std::regex("\\s*CAP_(\\w+)"), ",+$1");
  std::transform(caps.begin(), caps.end(), caps.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return "-all" + caps;
}

std::vector<std::string> asUser(std::pair<uid_t, gid_t> user) {
  return {"/usr/bin/setpriv", "--reuid=" + std::to_string(user.first), "--regid=" + std::to_string(user.second),
          "--clear-groups"};
}

TEST(CallerIdentity, TheConfinedDaemonAdmitsByTheRecordedUserWhateverTheCallerExecs) {
  // The daemon runs as "nobody", the attacker as "daemon": users every Debian system has.
  auto ids = [](const char* name) {
    const passwd* p = getpwnam(name);  // each lookup overwrites the last one's answer
    return p ? std::optional(std::pair{p->pw_uid, p->pw_gid}) : std::nullopt;
  };
  const auto daemonUser = ids("nobody"), attacker = ids("daemon");
  if (geteuid() != 0 || !daemonUser || !attacker) GTEST_SKIP() << "needs root and the users nobody and daemon";
  Harness harness(/*anyUser=*/true);
  harness.entitleSelf();
  harness.writeManifest("sleep", std::filesystem::canonical("/usr/bin/sleep").string());
  // /proc mounted the way the unit's ProtectProc, ProcSubset and ReadOnlyPaths ask, then the
  // unit's user and capabilities with no new privileges.
  const std::string ambient = setprivCapabilities("AmbientCapabilities");
  // clang-format off
  std::vector<std::string> launcher = {"/usr/bin/unshare", "--mount", "--propagation", "private", "--", "/bin/sh", "-c",
      "mount -t proc -o hidepid=" + unitSetting("ProtectProc") + ",subset=" + unitSetting("ProcSubset") +
          " proc /proc && mount -o remount,bind," + (unitSetting("ReadOnlyPaths") == "/proc" ? "ro" : "rw") +
          " /proc && exec \"$@\"", "sh"};
  // clang-format on
  for (const auto& argument : asUser(*daemonUser)) launcher.push_back(argument);
  launcher.insert(launcher.end(), {"--no-new-privs", "--inh-caps=" + ambient, "--ambient-caps=" + ambient,
                                   "--bounding-set=" + setprivCapabilities("CapabilityBoundingSet"), "--"});
  ASSERT_TRUE(harness.startDaemon({}, launcher)) << harness.daemon()->standardError();
  const std::string status = "/proc/" + std::to_string(harness.daemon()->pid()) + "/status";
  uid_t realUid = 0;
  std::istringstream(lineAfter(status, "Uid:")) >> realUid;
  EXPECT_EQ(realUid, daemonUser->first);
  EXPECT_EQ(lineAfter(status, "CapEff:"), "\t0000000000080000");  // CAP_SYS_PTRACE alone
  EXPECT_EQ(outcome(harness.connect()->confirmActivation({sampleToken(), "U"})), "ok")
      << harness.daemon()->standardError();

  // borrow_identity connects, then execs sleep, which this user's manifest entitles, and calls
  // from a forked child on the same connection. For this user the gate passes and the empty call
  // fails on its arguments, which shows the attempt reaches the gate; for another it is refused.
  for (const auto& [user, answer] :
       {std::pair{std::pair{uid_t{0}, gid_t{0}}, "com.kestro.ZLKAuthentication.Error.InvalidParameter"},
        std::pair{*attacker, "com.kestro.ZLKAuthentication.Error.MissingEntitlement"}}) {
    std::vector<std::string> argv = asUser(user);
    argv.insert(argv.end(), {BORROW_IDENTITY_PATH, harness.busAddress(), "/usr/bin/sleep", "60"});
    auto run = zlkatest::runToEnd(argv, harness.directory());
    EXPECT_EQ(run.out, std::string(answer) + "\n") << run.err << harness.daemon()->standardError();
  }
}

TEST(TaskLimit, EveryCallerIsAnsweredAndTheDaemonServesOn) {
  // A pids group with room for the daemon's loop, its pools' first workers and one HTTP worker,
  // not for the second: the session cannot be opened and every thread asked for under load is refused.
  std::filesystem::path group;
  for (const char* root : {"/sys/fs/cgroup/pids", "/sys/fs/cgroup"}) {
    std::filesystem::path dir = std::filesystem::path(root) / ("zlka-test-" + std::to_string(getpid()));
    std::error_code ec;
    if (!std::filesystem::exists(std::filesystem::path(root) / "cgroup.procs") ||
        !std::filesystem::create_directory(dir, ec))
      continue;
    std::ofstream(dir / "pids.max") << 5;
    if (std::filesystem::exists(dir / "pids.max")) {
      group = dir;
      break;
    }
    std::filesystem::remove(dir, ec);
  }
  if (group.empty()) GTEST_SKIP() << "no pids cgroup can be made here";
  std::shared_ptr<void> removal(nullptr, [&group](void*) {  // once the daemon has gone and the group is empty
    for (int i = 0; i < 100 && ::rmdir(group.c_str()) != 0; ++i) usleep(50'000);
  });
  Harness harness;
  harness.entitleSelf();
  ASSERT_TRUE(harness.startDaemon(
      {}, {"/bin/sh", "-c", "echo $$ > " + (group / "cgroup.procs").string() + " && exec \"$@\"", "sh"}))
      << harness.daemon()->standardError();
  std::vector<std::unique_ptr<ZLKAClient>> clients;
  std::vector<std::future<void>> answered;
  for (int i = 0; i < 20; ++i) {
    ASSERT_TRUE(clients.emplace_back(harness.connect()));
    auto promise = std::make_shared<std::promise<void>>();
    answered.push_back(promise->get_future());
    // Success or an error: one answer each (a second would throw here), from a daemon still there.
    clients.back()->confirmActivationAsync({sampleToken(), "U"}, [promise](auto) { promise->set_value(); });
  }
  for (auto& a : answered) ASSERT_EQ(a.wait_for(std::chrono::seconds(60)), std::future_status::ready);
  EXPECT_FALSE(harness.daemon()->waitExit(std::chrono::milliseconds(0))) << harness.daemon()->standardError();
  std::ifstream events(group / "pids.events");
  std::string key;
  long refusals = -1;
  EXPECT_TRUE(events >> key >> refusals && key == "max" && refusals > 0)
      << "the limit never bit: raise the callers or lower the limit";

  // And it serves callers again once there is room: the transfer's worker starts when needed.
  std::ofstream(group / "pids.max") << "max";
  bool served = false;
  for (int i = 0; i < 30 && !(served = clients.front()->confirmActivation({sampleToken(), "U"}).ok()); ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(500));
  EXPECT_TRUE(served) << harness.daemon()->standardError();
  harness.daemon()->signal(SIGTERM);
  EXPECT_EQ(harness.daemon()->waitExit(std::chrono::seconds(30)), 0);
}

}  // namespace
}  // namespace service_test
