// The internal build's controls in the developer settings suite: the fault-injection switches and
// where each acts, and server selection. (How stored values read as Booleans and strings, and
// that the suite is read afresh, are the settings store's rules.)
#include "common/rows.h"
#include "network/zlka_network_constants.h"
#include "network_fixture.h"

namespace nettest {
namespace {

struct Switch {
  const char* key;
  bool (ZLKANetwork::*get)();
  void (ZLKANetwork::*set)(bool);
};

const Switch kSwitches[] = {
    {ZLKAUserDefaultsKey_ForceNetworkFailure, &ZLKANetwork::forceNetworkFailure, &ZLKANetwork::setForceNetworkFailure},
    {ZLKAUserDefaultsKey_ForceTokenActivationFailure, &ZLKANetwork::forceTokenActivationFailure,
     &ZLKANetwork::setForceTokenActivationFailure},
    {ZLKAUserDefaultsKey_ForceTokenConfirmationFailure, &ZLKANetwork::forceTokenConfirmationFailure,
     &ZLKANetwork::setForceTokenConfirmationFailure},
    {ZLKAUserDefaultsKey_ForceTarvexSAPFailure, &ZLKANetwork::forceTarvexSAPFailure,
     &ZLKANetwork::setForceTarvexSAPFailure},
};

// Each switch is the suite's value for its own key and the instance's internal-build flag, read
// at every call; the setters store values that nothing reads.
TEST_F(NetworkTest, EachSwitchIsItsOwnKeyOnAnInternalBuild) {
  ZLKANetwork& net = *network();
  EXPECT_TRUE(net.isInternalBuild()) << "the instance copies the device fact";
  for (const Switch& s : kSwitches) {
    (net.*s.set)(true);
    EXPECT_FALSE((net.*s.get)()) << s.key << " follows its setter";
    suite().set(s.key, true);
    for (const Switch& other : kSwitches)
      EXPECT_EQ((net.*other.get)(), other.key == s.key) << other.key << " while " << s.key << " is set";
    net.setIsInternalBuild(false);
    EXPECT_FALSE((net.*s.get)()) << s.key << " without the internal-build flag";
    net.setIsInternalBuild(true);
    (net.*s.set)(false);
    suite().remove(s.key);
  }
}

struct SwitchRow {
  const char* name;
  std::vector<const char*> keys;
  Call call;
  int64_t code;      // 0: success
  std::string line;  // the one forcing line logged, at default level
};

const char kNetwork[] = "[#TokenAuth] Forcing network failure...";
const Data kNotDER = Data::fromString("not DER");

// clang-format off
const SwitchRow kSwitchRows[] = {
  {"NetworkFailsTheQuery", {ZLKAUserDefaultsKey_ForceNetworkFailure}, {}, ZLKAErrorNetwork, kNetwork},
  {"NetworkFailsActivation", {ZLKAUserDefaultsKey_ForceNetworkFailure}, {.op = Op::activation}, ZLKAErrorNetwork, kNetwork},
  {"NetworkFailsConfirmation", {ZLKAUserDefaultsKey_ForceNetworkFailure}, {.op = Op::confirmation}, ZLKAErrorNetwork, kNetwork},
  {"NetworkComesBeforeActivation", {ZLKAUserDefaultsKey_ForceNetworkFailure, ZLKAUserDefaultsKey_ForceTokenActivationFailure}, {.op = Op::activation}, ZLKAErrorNetwork, kNetwork},
  {"NetworkComesBeforeConfirmation", {ZLKAUserDefaultsKey_ForceNetworkFailure, ZLKAUserDefaultsKey_ForceTokenConfirmationFailure}, {.op = Op::confirmation}, ZLKAErrorNetwork, kNetwork},
  // Before the token is taken apart: a blob that does not parse gets the forced failure too.
  {"ActivationFailsActivation", {ZLKAUserDefaultsKey_ForceTokenActivationFailure}, {.op = Op::activation, .token = kNotDER}, ZLKAErrorNetwork, "[#TokenAuth] Forcing token activation failure..."},
  {"ConfirmationFailsConfirmation", {ZLKAUserDefaultsKey_ForceTokenConfirmationFailure}, {.op = Op::confirmation, .token = kNotDER}, ZLKAErrorNetwork, "[#TokenAuth] Forcing token confirmation failure..."},
  {"ActivationSparesConfirmation", {ZLKAUserDefaultsKey_ForceTokenActivationFailure}, {.op = Op::confirmation}, 0, ""},
  {"ConfirmationSparesActivation", {ZLKAUserDefaultsKey_ForceTokenConfirmationFailure}, {.op = Op::activation}, 0, ""},
};
// clang-format on

class SwitchTest : public NetworkTest, public ::testing::WithParamInterface<SwitchRow> {};

// A forced failure sends nothing, not even for the session.
TEST_P(SwitchTest, ActsWhereItBelongs) {
  for (const char* key : GetParam().keys) suite().set(key, true);
  const Outcome outcome = run(GetParam().call);
  if (GetParam().code == 0) {
    EXPECT_FALSE(outcome.error) << log().dump();
    EXPECT_EQ(log().countStartingWith("[#TokenAuth] Forcing"), 0);
    return;
  }
  expectFailure(outcome, GetParam().code);
  EXPECT_EQ(log().count(LogLevel::Default, GetParam().line), 1);
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Forcing"), 1) << log().dump();
  EXPECT_EQ(admin().requests(), 0u);
}

ZLKA_ROWS(SwitchTest, SwitchRow, kSwitchRows);

// The secure-association switch puts "1234" in place of the request's signature, without opening
// the session (the server refuses it with 401), and is read again for the answer: turned on while
// the request is signed, it fails the verification of a properly signed answer.
TEST_F(NetworkTest, TheSAPSwitchReplacesEachSignature) {
  suite().set(ZLKAUserDefaultsKey_ForceTarvexSAPFailure, true);
  expectFailure(run(), ZLKAErrorInternal);
  EXPECT_EQ(admin().rejected(), 1u);
  EXPECT_EQ(admin().handshakes(), 0u);
  expectLine(LogLevel::Debug,
             "[#TokenAuth] request.allHTTPHeaderFields: {\"Accept\": \"application/json\", \"Content-Type\": "
             "\"application/json\", \"protocol-version\": \"1.0\", \"session-identifier\": \"" +
                 network()->tarvexSAPSession()->UUID().UUIDString() + "\", \"signature\": \"MTIzNA==\"}");
  suite().remove(ZLKAUserDefaultsKey_ForceTarvexSAPFailure);

  TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library();
  primitives.sign = [sign = primitives.sign](auto... a) {
    world().suite().set(ZLKAUserDefaultsKey_ForceTarvexSAPFailure, true);
    return sign(a...);
  };
  installSession(primitives);
  const Outcome outcome = run({.op = Op::activation});
  expectFailure(outcome, ZLKAErrorServer);
  expectLine(LogLevel::Error, "[#TokenAuth] tarvexError: ", outcome.logStart);
  EXPECT_EQ(admin().verified(), 1u) << "the request carried a real signature";
}

enum class Server { staticContent, sap, api };

struct SelectionRow {
  const char* name;
  std::vector<std::pair<const char*, Value>> settings;
  Server server;
  std::string expected;
  std::string fallbackFor;  // the unknown name the error line reports, if any
};

// clang-format off
const SelectionRow kSelections[] = {
  {"NothingStoredIsProductionAPI", {}, Server::api, "https://api.prod.test", ""},
  {"NothingStoredIsProductionStatic", {}, Server::staticContent, "https://static.prod.test", ""},
  {"NothingStoredIsProductionSAP", {}, Server::sap, "https://api.prod.test", ""},
  {"APINamesAnEnvironment", {{"Server", "it"}}, Server::api, "https://api.it.test", ""},
  {"StaticNamesAnEnvironment", {{"StaticContentServer", "maint"}}, Server::staticContent, "https://static.maint.test", ""},
  // An environment's secure-association server is its API server.
  {"SAPNamesAnEnvironment", {{"TarvexSAPServer", "ut"}}, Server::sap, "https://api.ut.test", ""},
  {"APIKeyLeavesStaticAlone", {{"Server", "it"}}, Server::staticContent, "https://static.prod.test", ""},
  {"APIKeyLeavesSAPAlone", {{"Server", "it"}}, Server::sap, "https://api.prod.test", ""},
  {"StaticKeyLeavesAPIAlone", {{"StaticContentServer", "it"}}, Server::api, "https://api.prod.test", ""},
  // Names are compared exactly; an unknown one falls back to production with an error line.
  {"NameInTheWrongCase", {{"Server", "UT"}}, Server::api, "https://api.prod.test", "UT"},
  {"UnknownStaticName", {{"StaticContentServer", "staging"}}, Server::staticContent, "https://static.prod.test", "staging"},
  {"NotAStringIsNothing", {{"Server", 42}}, Server::api, "https://api.prod.test", ""},
  {"Custom", {{"Server", "custom"}, {"CustomServer", "https://custom.test:8443"}}, Server::api, "https://custom.test:8443", ""},
  {"CustomWithoutBaseIsEmpty", {{"Server", "custom"}}, Server::api, "", ""},
  {"CustomNotOfferedForStatic", {{"StaticContentServer", "custom"}, {"CustomServer", "https://c.test"}}, Server::staticContent, "https://static.prod.test", "custom"},
  {"CustomNotOfferedForSAP", {{"TarvexSAPServer", "custom"}, {"CustomServer", "https://c.test"}}, Server::sap, "https://api.prod.test", "custom"},
};
// clang-format on

class SelectionTest : public NetworkTest, public ::testing::WithParamInterface<SelectionRow> {};

TEST_P(SelectionTest, PicksTheNamedServer) {
  zlkatest::ScopedConfiguration environments([](platform::Configuration& c) {
    for (std::string name : {"prod", "it", "ut", "maint"})
      c.servers[name] = {"https://static." + name + ".test", "https://api." + name + ".test"};
  });
  for (const auto& [key, value] : GetParam().settings) suite().set(key, value);
  ZLKANetwork& net = *network();
  const Server server = GetParam().server;
  EXPECT_EQ(server == Server::api   ? net._selectedAPIServer()
            : server == Server::sap ? net._selectedTarvexSAPServer()
                                    : net._selectedStaticContentServer(),
            GetParam().expected);
  const std::string fallback =
      "[#TokenAuth] Unknown server selected: '" + GetParam().fallbackFor + "'. Falling back to production server...";
  EXPECT_EQ(log().count(LogLevel::Error, fallback), GetParam().fallbackFor.empty() ? 0 : 1);
  EXPECT_EQ(log().countStartingWith("[#TokenAuth]"), GetParam().fallbackFor.empty() ? 0 : 1) << log().dump();
}

ZLKA_ROWS(SelectionTest, SelectionRow, kSelections);

// The selections decide where the traffic goes: the certificate to the static server, the
// handshake to the secure-association server, the requests to the API server. A base URL left
// empty ("custom" without "CustomServer") fails like a transport error.
TEST_F(NetworkTest, TheSelectedServersCarryTheTraffic) {
  zlkatest::ScopedConfiguration environments([](platform::Configuration& c) {
    const std::string live = world().baseURL(), refused = world().refusedURL();
    c.servers["prod"] = {live, refused};
    c.servers["it"] = {refused, live};
    c.servers["ut"] = {live, refused};
  });
  expectFailure(run(), ZLKAErrorNetwork);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  EXPECT_EQ(admin().requests("sapSession"), 0u);
  suite().set("TarvexSAPServer", "it");
  suite().set("StaticContentServer", "it");
  expectFailure(run(), ZLKAErrorNetwork);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  suite().set("StaticContentServer", "ut");
  suite().set("Server", "custom");
  expectFailure(run({.op = Op::confirmation}), ZLKAErrorNetwork);
  EXPECT_EQ(admin().handshakes(), 1u);
  suite().set("CustomServer", world().baseURL());
  EXPECT_FALSE(run().error) << log().dump();
  EXPECT_EQ(admin().requests("queryProductPlan"), 1u);
}

}  // namespace
}  // namespace nettest
