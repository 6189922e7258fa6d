// The four fault-injection switches on an internal build: each is the suite's Boolean for its key
// AND the instance's internal-build flag, read afresh at every call. The setters store values
// that nothing reads.
#include <string>
#include <vector>

#include "network/zlka_network_constants.h"
#include "network_test_environment.h"
#include "operation_calls.h"

namespace nettest {
namespace {

using platform::Value;

struct Switch {
  const char* key;
  bool (ZLKANetwork::*get)();
  void (ZLKANetwork::*set)(bool);
};

const std::vector<Switch>& switches() {
  static const std::vector<Switch> all = {
      {ZLKAUserDefaultsKey_ForceNetworkFailure, &ZLKANetwork::forceNetworkFailure,
       &ZLKANetwork::setForceNetworkFailure},
      {ZLKAUserDefaultsKey_ForceTokenActivationFailure, &ZLKANetwork::forceTokenActivationFailure,
       &ZLKANetwork::setForceTokenActivationFailure},
      {ZLKAUserDefaultsKey_ForceTokenConfirmationFailure, &ZLKANetwork::forceTokenConfirmationFailure,
       &ZLKANetwork::setForceTokenConfirmationFailure},
      {ZLKAUserDefaultsKey_ForceTarvexSAPFailure, &ZLKANetwork::forceTarvexSAPFailure,
       &ZLKANetwork::setForceTarvexSAPFailure},
  };
  return all;
}

class FaultSwitchesTest : public NetworkTest {
 protected:
  void TearDown() override {
    for (const Switch& s : switches()) (*network().*s.set)(false);
    network()->setIsInternalBuild(true);
    NetworkTest::TearDown();
  }
};

TEST_F(FaultSwitchesTest, TheInstanceCopiesTheInternalBuildFact) { EXPECT_TRUE(network()->isInternalBuild()); }

// How the suite's stored values read as a switch.
TEST_F(FaultSwitchesTest, EachSwitchIsTheSuitesBooleanForItsKey) {
  struct Stored {
    std::optional<Value> value;
    bool on;
  };
  const std::vector<Stored> table = {
      {std::nullopt, false},
      {Value(true), true},
      {Value(false), false},
      {Value(1), true},
      {Value(0), false},
      {Value(2.5), true},
      {Value("YES"), true},
      {Value("yes"), true},
      {Value("True"), true},
      {Value("1"), true},
      {Value("no"), false},
      {Value("on"), false},
      {Value(""), false},
      {Value(platform::Null{}), false},
      {Value(platform::Array{Value(true)}), false},
  };
  for (const Switch& s : switches()) {
    for (const Stored& stored : table) {
      if (stored.value)
        suite().set(s.key, *stored.value);
      else
        suite().remove(s.key);
      EXPECT_EQ((*network().*s.get)(), stored.on)
          << s.key << " = " << (stored.value ? stored.value->description() : "(none)");
      // Only its own key counts.
      for (const Switch& other : switches()) {
        if (other.key != s.key) {
          EXPECT_FALSE((*network().*other.get)()) << other.key << " while " << s.key << " is set";
        }
      }
    }
    suite().remove(s.key);
  }
}

TEST_F(FaultSwitchesTest, SettersChangeNothing) {
  for (const Switch& s : switches()) {
    (*network().*s.set)(true);
    EXPECT_FALSE((*network().*s.get)()) << s.key;
    suite().set(s.key, true);
    (*network().*s.set)(false);
    EXPECT_TRUE((*network().*s.get)()) << s.key;
    suite().remove(s.key);
  }
  // With every setter on, the operations still run normally.
  for (const Switch& s : switches()) (*network().*s.set)(true);
  EXPECT_FALSE(requestMetadata().error);
  EXPECT_FALSE(requestActivation().error);
  EXPECT_FALSE(confirmActivation().error);
}

// The switches read the instance's copy of the fact; server selection reads the process-wide one.
TEST_F(FaultSwitchesTest, SwitchesFollowTheInstanceFlagAndSelectionTheProcessFact) {
  ScopedConfiguration servers([](platform::Configuration& c) {
    c.servers["it"] = {"https://static.it.test", "https://api.it.test"};
  });
  for (const Switch& s : switches()) suite().set(s.key, true);
  suite().set("Server", "it");
  network()->setIsInternalBuild(false);
  for (const Switch& s : switches()) EXPECT_FALSE((*network().*s.get)()) << s.key;
  EXPECT_EQ(network()->_selectedAPIServer(), "https://api.it.test");
  network()->setIsInternalBuild(true);
  for (const Switch& s : switches()) EXPECT_TRUE((*network().*s.get)()) << s.key;
}

}  // namespace
}  // namespace nettest
