// A production device, in a process of its own because device facts are fixed once per process:
// the shared instance's creation, which must be the first touch of it in the process, and a
// developer settings suite that changes nothing.
#include <fstream>
#include <latch>
#include <set>
#include <thread>

#include "network_fixture.h"
#include "platform/values/exception.h"

namespace nettest {
namespace {

[[maybe_unused]] ::testing::Environment* const kWorld =
    ::testing::AddGlobalTestEnvironment(new zlkatest::ServerWorld(false));

// Declared first, so that it runs first when the binary runs all its tests in one process.
TEST(SharedInstanceTest, IsMadeOnceByTheFirstOfManyConcurrentCallers) {
  log().clear();
  std::vector<ZLKANetwork*> seen(16);
  std::latch start(16);
  std::vector<std::thread> threads;
  for (auto& instance : seen)
    threads.emplace_back([&] { start.arrive_and_wait(), instance = ZLKANetwork::sharedInstance().get(); });
  for (auto& t : threads) t.join();
  EXPECT_EQ(std::set<ZLKANetwork*>(seen.begin(), seen.end()), std::set{network().get()});
  ASSERT_EQ(log().count(LogLevel::Debug, "[#TokenAuth] Initializing ZLKANetwork..."), 1) << "made before this test:\n"
                                                                                         << log().dump();
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Initializ"), 2);
}

TEST(SharedInstanceTest, IsAProductionOneReachedThroughTheExportedObject) {
  EXPECT_FALSE(network()->isInternalBuild());
  EXPECT_THROW(ZLKANetwork::init(), platform::InternalInconsistencyException);
  // The tests install sessions of their own: the one it made must answer to it.
  EXPECT_EQ(network()->tarvexSAPSession()->delegate().lock(),
            std::static_pointer_cast<TarvexSAPSessionDelegate>(network()));
  // The exported object forwards the call as it is: with no peer being served, the gate refuses it.
  std::optional<Error> error;
  network()->exportedObject()->confirmActivationForToken(sampleToken(), std::string(kUUID), [&](auto e) { error = e; });
  EXPECT_EQ(error.value_or(Error("none", 0)).code(), ZLKAErrorMissingEntitlement);
}

// Whatever the suite holds (every switch on, other servers named, even text that does not parse),
// a production device never forces a failure and uses the production servers, whose selection
// reads nothing and logs nothing. Every other environment refuses connections here.
TEST_F(NetworkTest, TheSuiteChangesNothing) {
  zlkatest::ScopedConfiguration environments([](platform::Configuration& c) {
    for (const char* name : {"it", "ut", "maint"}) c.servers[name] = {world().refusedURL(), world().refusedURL()};
  });
  for (const char* key : {ZLKAUserDefaultsKey_ForceNetworkFailure, ZLKAUserDefaultsKey_ForceTokenActivationFailure,
                          ZLKAUserDefaultsKey_ForceTokenConfirmationFailure, ZLKAUserDefaultsKey_ForceTarvexSAPFailure})
    suite().setObject(key, true);
  suite().setObject(ZLKAUserDefaultsKey_Server, "ut");
  suite().setObject(ZLKAUserDefaultsKey_TarvexSAPServer, "maint");
  suite().setObject(ZLKAUserDefaultsKey_StaticContentServer, "it");
  for (Op op : {Op::metadata, Op::activation, Op::confirmation}) EXPECT_FALSE(run({.op = op}).error) << log().dump();
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Forcing"), 0);
  EXPECT_EQ(admin().stat("verified"), 3u);
  for (const char* contents :
       {R"({"Server": "UT", "StaticContentServer": "custom", "TarvexSAPServer": "nowhere"})", "{ not json"}) {
    std::ofstream(suite().filePath()) << contents;
    const size_t mark = log().size();
    for (const std::string& url : {network()->_selectedAPIServer(), network()->_selectedTarvexSAPServer(),
                                   network()->_selectedStaticContentServer()})
      EXPECT_EQ(url, world().baseURL());
    EXPECT_EQ(log().size(), mark) << log().dump();
  }
  // Nor do the switches: an operation never reads the unparsable suite (which would log that).
  EXPECT_FALSE(run({.op = Op::confirmation}).error);
  EXPECT_EQ(log().countStartingWith("Settings suite"), 0) << log().dump();
}

}  // namespace
}  // namespace nettest
