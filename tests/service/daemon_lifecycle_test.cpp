// Start-up, shutdown and idling of the daemon process.
#include <gtest/gtest.h>
#include <signal.h>

#include <fstream>
#include <future>
#include <vector>

#include "client/zlka_client.h"
#include "service/daemon_harness.h"

using service_test::Harness;

TEST(DaemonLifecycle, ABadConfigurationStopsTheStartNamingTheKey) {
  Harness harness;
  auto config = harness.directory() / "broken.toml";
  std::ifstream in(harness.configFile());
  std::string text((std::istreambuf_iterator<char>(in)), {});
  auto at = text.find("api = \"https://");
  ASSERT_NE(at, std::string::npos);
  text.replace(at, 15, "api = \"http://");
  std::ofstream(config) << text;
  auto result = service_test::runToEnd({ZLKAD_PATH, "--config", config.string(), "--bus", harness.busAddress()}, harness.directory());
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.err.find("broken.toml"), std::string::npos) << result.err;
  EXPECT_NE(result.err.find("servers.prod.api"), std::string::npos) << result.err;

  auto missing = service_test::runToEnd({ZLKAD_PATH, "--config", (harness.directory() / "absent.toml").string()}, harness.directory());
  EXPECT_EQ(missing.status, 1);
  EXPECT_NE(missing.err.find("absent.toml"), std::string::npos) << missing.err;

  auto usage = service_test::runToEnd({ZLKAD_PATH, "--log-level", "loud"}, harness.directory());
  EXPECT_EQ(usage.status, 2) << usage.err;
}

TEST(DaemonLifecycle, SigtermDuringRequestsAnswersEveryOne) {
  Harness harness;
  harness.writeManifest("self", std::filesystem::read_symlink("/proc/self/exe").string(),
                        platform::Value(platform::Array{"token-auth"}));
  ASSERT_TRUE(harness.startDaemon());
  auto client = zlka_client::ZLKAClient::connect({.bus = harness.busAddress()});
  ASSERT_TRUE(client.ok());
  // Open the session first, so that the requests below are all in flight together.
  ASSERT_TRUE(client.value()->confirmActivation({.token = service_test::sampleToken(), .uuid = "U"}).ok());
  harness.setFault(R"({"endpoint": "ackAccessory", "delay_ms": 400})");

  constexpr int kRequests = 8;
  std::vector<std::promise<zlka_client::Result<zlka_client::Confirmation>>> answers(kRequests);
  for (int i = 0; i < kRequests; ++i)
    client.value()->confirmActivationAsync({.token = service_test::sampleToken(), .uuid = "U"},
                                           [&answers, i](auto r) { answers[i].set_value(std::move(r)); });
  // Wait until the server holds at least one of them, then stop the daemon.
  for (int i = 0; i < 500; ++i) {
    auto stats = harness.stats();
    const platform::Value* requests = stats.find("requests");
    const platform::Value* ack = requests ? requests->find("ackAccessory") : nullptr;
    if (ack && ack->numberValue().value_or(0) >= 2) break;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  harness.daemon()->signal(SIGTERM);
  int answered = 0, succeeded = 0;
  for (auto& a : answers) {
    auto f = a.get_future();
    ASSERT_EQ(f.wait_for(std::chrono::seconds(60)), std::future_status::ready);
    auto r = f.get();
    ++answered;
    if (r.ok()) ++succeeded;
    else EXPECT_EQ(*r.error().userInfo()->at("DBusErrorName").string(), "org.freedesktop.DBus.Error.NoServer");
  }
  EXPECT_EQ(answered, kRequests);
  EXPECT_GE(succeeded, 1);  // the ones already in flight completed
  EXPECT_EQ(harness.daemon()->waitExit(std::chrono::seconds(30)), 0);
  EXPECT_NE(harness.daemon()->standardError().find("Shutting down (SIGTERM)"), std::string::npos);
}

TEST(DaemonLifecycle, ExitsOnIdleWhenAsked) {
  Harness harness;
  ASSERT_TRUE(harness.startDaemon({"--exit-on-idle", "1"}));
  EXPECT_EQ(harness.daemon()->waitExit(std::chrono::seconds(20)), 0);
  EXPECT_NE(harness.daemon()->standardError().find("Shutting down (idle)"), std::string::npos);
}
