// The daemon under a task limit: when it cannot start a thread, calls wait or fail, the daemon
// does not. Run where a pids cgroup can be made (root with cgroup v1 or v2 pids).
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <fstream>
#include <future>
#include <thread>
#include <vector>

#include "client/zlka_client.h"
#include "service/daemon_harness.h"

using service_test::Harness;

namespace {

// A pids cgroup of its own, removed at the end; empty path when the machine has none to offer.
class PidsCgroup {
 public:
  explicit PidsCgroup(int limit) {
    for (const char* root : {"/sys/fs/cgroup/pids", "/sys/fs/cgroup"}) {
      std::filesystem::path dir = std::filesystem::path(root) / ("zlka-test-" + std::to_string(getpid()));
      std::error_code ec;
      if (!std::filesystem::exists(std::filesystem::path(root) / "cgroup.procs") || !std::filesystem::create_directory(dir, ec))
        continue;
      std::ofstream(dir / "pids.max") << limit;
      if (std::filesystem::exists(dir / "pids.max")) {
        path_ = dir;
        return;
      }
      std::filesystem::remove(dir, ec);
    }
  }
  ~PidsCgroup() {
    if (path_.empty()) return;
    // The daemon has been stopped by now; rmdir succeeds once the group is empty.
    for (int i = 0; i < 100 && ::rmdir(path_.c_str()) != 0; ++i) usleep(50'000);
  }
  const std::filesystem::path& path() const { return path_; }
  void setLimit(const std::string& limit) const { std::ofstream(path_ / "pids.max") << limit; }
  // How many times a task could not be made for want of room in the group.
  long refusals() const {
    std::ifstream in(path_ / "pids.events");
    std::string key;
    long count = -1;
    in >> key >> count;
    return key == "max" ? count : -1;
  }

 private:
  std::filesystem::path path_;
};

}  // namespace

TEST(TaskLimit, EveryCallerIsAnsweredAndTheDaemonServesOn) {
  // Room for the daemon's loop, its pools' first workers and one HTTP worker, not for the second:
  // the session cannot be opened, and every thread the pools ask for under load is refused.
  PidsCgroup cgroup(5);
  if (cgroup.path().empty()) GTEST_SKIP() << "no pids cgroup can be made here";
  Harness harness;
  harness.writeManifest("self", std::filesystem::read_symlink("/proc/self/exe").string(),
                        platform::Value(platform::Array{"token-auth"}));
  std::vector<std::string> joinCgroup = {"/bin/sh", "-c", "echo $$ > " + (cgroup.path() / "cgroup.procs").string() + " && exec \"$@\"",
                                         "sh"};
  ASSERT_TRUE(harness.startDaemon({}, joinCgroup)) << harness.daemon()->standardError();

  constexpr int kCallers = 20;
  std::vector<std::unique_ptr<zlka_client::ZLKAClient>> clients;
  std::vector<std::future<void>> answered;
  for (int i = 0; i < kCallers; ++i) {
    auto made = zlka_client::ZLKAClient::connect({.bus = harness.busAddress()});
    ASSERT_TRUE(made.ok());
    clients.push_back(std::move(made).value());
    auto promise = std::make_shared<std::promise<void>>();
    answered.push_back(promise->get_future());
    // Success or an error: what matters is one answer each (a second would throw here), from a
    // daemon that is still there.
    clients.back()->confirmActivationAsync({.token = service_test::sampleToken(), .uuid = "U"},
                                           [promise](auto) { promise->set_value(); });
  }
  for (auto& a : answered) ASSERT_EQ(a.wait_for(std::chrono::seconds(60)), std::future_status::ready);
  EXPECT_FALSE(harness.daemon()->waitExit(std::chrono::milliseconds(0)).has_value()) << harness.daemon()->standardError();
  EXPECT_GT(cgroup.refusals(), 0) << "the limit never bit: raise the callers or lower the limit";

  // And it serves callers again once there is room: the transfer's worker starts when needed.
  cgroup.setLimit("max");
  bool served = false;
  for (int i = 0; i < 30 && !served; ++i) {
    served = clients.front()->confirmActivation({.token = service_test::sampleToken(), .uuid = "U"}).ok();
    if (!served) std::this_thread::sleep_for(std::chrono::milliseconds(500));
  }
  EXPECT_TRUE(served) << harness.daemon()->standardError();
  harness.daemon()->signal(SIGTERM);
  EXPECT_EQ(harness.daemon()->waitExit(std::chrono::seconds(30)), 0);
}
