// A production device: whatever the developer settings suite holds, the switches stay off, the
// production servers are used, and selection neither reads the suite nor logs anything.
#include <string>

#include "network/zlka_network_constants.h"
#include "network_test_environment.h"
#include "operation_calls.h"
#include "support/errors.h"
#include "support/system_info.h"

namespace nettest {
namespace {

using platform::LogLevel;

// Every other environment refuses connections: a success proves production was used.
class ProductionDeviceTest : public NetworkTest {
 protected:
  ProductionDeviceTest()
      : servers_([](platform::Configuration& c) {
          const std::string refused = environment().refusedURL();
          for (const char* name : {"it", "ut", "maint"}) c.servers[name] = {refused, refused};
        }) {}

  void storeEverything() {
    for (const char* key :
         {ZLKAUserDefaultsKey_ForceNetworkFailure, ZLKAUserDefaultsKey_ForceTokenActivationFailure,
          ZLKAUserDefaultsKey_ForceTokenConfirmationFailure, ZLKAUserDefaultsKey_ForceTarvexSAPFailure})
      suite().set(key, true);
    suite().set(ZLKAUserDefaultsKey_Server, "ut");
    suite().set(ZLKAUserDefaultsKey_TarvexSAPServer, "maint");
    suite().set(ZLKAUserDefaultsKey_StaticContentServer, "it");
    suite().set(ZLKAUserDefaultsKey_CustomServer, environment().refusedURL());
  }

 private:
  ScopedConfiguration servers_;
};

TEST_F(ProductionDeviceTest, IsNotAnInternalBuild) {
  EXPECT_FALSE(systemInfo_isInternalBuild());
  EXPECT_FALSE(network()->isInternalBuild());
}

TEST_F(ProductionDeviceTest, SuiteChangesNothing) {
  storeEverything();
  EXPECT_FALSE(network()->forceNetworkFailure());
  EXPECT_FALSE(network()->forceTokenActivationFailure());
  EXPECT_FALSE(network()->forceTokenConfirmationFailure());
  EXPECT_FALSE(network()->forceTarvexSAPFailure());

  const MetadataOutcome metadata = requestMetadata();
  EXPECT_FALSE(metadata.error) << log().dump();
  EXPECT_EQ(metadata.ppid, "PP-0001-ACCESSORY");
  const ActivationOutcome activation = requestActivation();
  EXPECT_FALSE(activation.error) << log().dump();
  EXPECT_FALSE(confirmActivation(TokenCall().withToken(activation.newToken)).error) << log().dump();

  EXPECT_EQ(admin().handshakes(), 1u);
  EXPECT_EQ(admin().verified(), 3u);
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Forcing"), 0) << log().dump();
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Unknown server selected"), 0) << log().dump();
}

TEST_F(ProductionDeviceTest, SettersChangeNothing) {
  network()->setForceNetworkFailure(true);
  network()->setForceTokenActivationFailure(true);
  network()->setForceTokenConfirmationFailure(true);
  network()->setForceTarvexSAPFailure(true);
  EXPECT_FALSE(network()->forceNetworkFailure());
  EXPECT_FALSE(network()->forceTarvexSAPFailure());
  EXPECT_FALSE(requestActivation().error) << log().dump();
  EXPECT_FALSE(confirmActivation().error) << log().dump();
}

// Selection returns production before it would look at the suite: names it would reject, and a
// suite file it could not even read, leave no trace in the log.
TEST_F(ProductionDeviceTest, SelectionNeverReadsTheSuite) {
  const std::string production = environment().baseURL();
  for (const char* contents : {R"({"Server": "UT", "StaticContentServer": "custom", "TarvexSAPServer": "nowhere"})",
                               R"({"Server": "custom"})", "{ not json"}) {
    SCOPED_TRACE(contents);
    suite().writeRaw(contents);
    log().clear();
    EXPECT_EQ(network()->_selectedAPIServer(), production);
    EXPECT_EQ(network()->_selectedTarvexSAPServer(), production);
    EXPECT_EQ(network()->_selectedStaticContentServer(), production);
    EXPECT_EQ(log().size(), 0u) << log().dump();
  }
}

}  // namespace
}  // namespace nettest
