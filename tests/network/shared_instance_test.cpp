// Creation of the one ZLKANetwork: made on first use, once, whichever thread asks first; the
// forbidden initializer. This binary's first test must be the first to touch the instance.
#include <latch>
#include <set>
#include <thread>
#include <vector>

#include "network/zlka_network_constants.h"
#include "network_test_environment.h"
#include "platform/exception.h"
#include "platform/settings_store.h"

namespace nettest {
namespace {

using platform::LogLevel;

TEST(SharedInstanceTest, IsMadeOnceByTheFirstOfManyConcurrentCallers) {
  environment().log().clear();
  constexpr int kCallers = 16;
  std::vector<ZLKANetwork*> seen(kCallers);
  std::latch start(kCallers);
  std::vector<std::thread> threads;
  for (int i = 0; i < kCallers; ++i) {
    threads.emplace_back([&, i] {
      start.arrive_and_wait();
      seen[i] = ZLKANetwork::sharedInstance().get();
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(std::set<ZLKANetwork*>(seen.begin(), seen.end()).size(), 1u);
  EXPECT_NE(seen[0], nullptr);
  EXPECT_EQ(ZLKANetwork::sharedInstance().get(), seen[0]);

  const LogCapture& log = environment().log();
  const auto initializing = log.find(LogLevel::Debug, "[#TokenAuth] Initializing ZLKANetwork...");
  const auto initialized =
      log.find(LogLevel::Debug,
               "[#TokenAuth] Initialized Tarvex SAP Session: TarvexSAPSession <state: [Closed], TTL: 0.000000s>");
  ASSERT_TRUE(initializing) << "the instance was made before this test:\n" << log.dump();
  ASSERT_TRUE(initialized) << log.dump();
  EXPECT_LT(*initializing, *initialized);
  EXPECT_EQ(log.countStartingWith("[#TokenAuth] Initializ"), 2);
}

TEST(SharedInstanceTest, HoldsWhatItMadeAtCreation) {
  auto network = ZLKANetwork::sharedInstance();
  EXPECT_TRUE(network->isInternalBuild());
  ASSERT_TRUE(network->exportedObject());
  EXPECT_EQ(network->exportedObject(), ZLKANetwork::sharedInstance()->exportedObject());
  ASSERT_TRUE(network->userDefaults());
  EXPECT_EQ(network->userDefaults()->suiteName(), ZLKAUserDefaultsDomain);
  EXPECT_EQ(network->userDefaults()->filePath(), environment().suite().file());
  ASSERT_TRUE(network->urlSession());
  EXPECT_NE(network->urlSession(), platform::HTTPSession::sharedSession());
  ASSERT_TRUE(network->tarvexSAPSession());
  EXPECT_EQ(network->tarvexSAPSession()->delegate().lock().get(),
            static_cast<TarvexSAPSessionDelegate*>(network.get()));
}

TEST(SharedInstanceTest, InitIsForbidden) {
  try {
    ZLKANetwork::init();
    FAIL() << "init() returned";
  } catch (const platform::InternalInconsistencyException& e) {
    EXPECT_STREQ(e.what(), "Use +[ZLKANetwork sharedInstance] instead of +[ZLKANetwork init].");
  }
}

}  // namespace
}  // namespace nettest
