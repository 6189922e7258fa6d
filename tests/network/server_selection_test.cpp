// Server selection on an internal build: the suite names an environment for each of the three
// servers; unknown names fall back to production with an error line; "custom" is offered by the
// API server alone.
#include <ostream>
#include <string>
#include <utility>
#include <vector>

#include "network/zlka_network_constants.h"
#include "network_test_environment.h"
#include "operation_calls.h"
#include "support/errors.h"

namespace nettest {
namespace {

using platform::LogLevel;
using platform::Value;

enum class Selector { staticContent, tarvexSAP, api };

std::string select(Selector selector) {
  auto net = ZLKANetwork::sharedInstance();
  switch (selector) {
    case Selector::staticContent:
      return net->_selectedStaticContentServer();
    case Selector::tarvexSAP:
      return net->_selectedTarvexSAPServer();
    case Selector::api:
      return net->_selectedAPIServer();
  }
  return "?";
}

std::string fallbackLine(const std::string& name) {
  return "[#TokenAuth] Unknown server selected: '" + name + "'. Falling back to production server...";
}

// Every environment with base URLs of its own, so that each answer names where it came from.
class ServerSelectionTest : public NetworkTest {
 protected:
  ServerSelectionTest()
      : servers_([](platform::Configuration& c) {
          c.servers.clear();
          for (const char* name : {"prod", "it", "ut", "maint"})
            c.servers[name] = {std::string("https://static.") + name + ".test",
                               std::string("https://api.") + name + ".test"};
        }) {}

 private:
  ScopedConfiguration servers_;
};

struct SelectionCase {
  const char* name;
  std::vector<std::pair<const char*, Value>> settings;
  Selector selector;
  std::string expected;
  std::optional<std::string> fallbackFor;  // the name the error line reports, if any
};

// Shown by the test runner in place of the bytes of the parameter.
void PrintTo(const SelectionCase& c, std::ostream* out) { *out << c.name; }

class SelectionTableTest : public ServerSelectionTest, public ::testing::WithParamInterface<SelectionCase> {};

TEST_P(SelectionTableTest, PicksTheNamedServer) {
  const SelectionCase& c = GetParam();
  for (const auto& [key, value] : c.settings) suite().set(key, value);
  log().clear();

  EXPECT_EQ(select(c.selector), c.expected);

  if (c.fallbackFor) {
    EXPECT_EQ(log().count(LogLevel::Error, fallbackLine(*c.fallbackFor)), 1) << log().dump();
    EXPECT_EQ(log().countStartingWith("[#TokenAuth]"), 1) << log().dump();
  } else {
    EXPECT_EQ(log().countStartingWith("[#TokenAuth]"), 0) << "selection should be silent:\n" << log().dump();
  }
}

INSTANTIATE_TEST_SUITE_P(
    Suite, SelectionTableTest,
    ::testing::Values(
        SelectionCase{"nothing_stored_api", {}, Selector::api, "https://api.prod.test", std::nullopt},
        SelectionCase{"nothing_stored_static", {}, Selector::staticContent, "https://static.prod.test", std::nullopt},
        SelectionCase{"nothing_stored_sap", {}, Selector::tarvexSAP, "https://api.prod.test", std::nullopt},
        SelectionCase{"api_it", {{"Server", "it"}}, Selector::api, "https://api.it.test", std::nullopt},
        SelectionCase{"api_ut", {{"Server", "ut"}}, Selector::api, "https://api.ut.test", std::nullopt},
        SelectionCase{"api_maint", {{"Server", "maint"}}, Selector::api, "https://api.maint.test", std::nullopt},
        SelectionCase{"api_prod", {{"Server", "prod"}}, Selector::api, "https://api.prod.test", std::nullopt},
        SelectionCase{"static_maint",
                      {{"StaticContentServer", "maint"}},
                      Selector::staticContent,
                      "https://static.maint.test",
                      std::nullopt},
        SelectionCase{"sap_ut_uses_the_api_host",
                      {{"TarvexSAPServer", "ut"}},
                      Selector::tarvexSAP,
                      "https://api.ut.test",
                      std::nullopt},
        SelectionCase{"api_key_leaves_static_alone",
                      {{"Server", "it"}},
                      Selector::staticContent,
                      "https://static.prod.test",
                      std::nullopt},
        SelectionCase{
            "api_key_leaves_sap_alone", {{"Server", "it"}}, Selector::tarvexSAP, "https://api.prod.test", std::nullopt},
        SelectionCase{"static_key_leaves_api_alone",
                      {{"StaticContentServer", "it"}},
                      Selector::api,
                      "https://api.prod.test",
                      std::nullopt},
        SelectionCase{"wrong_case", {{"Server", "UT"}}, Selector::api, "https://api.prod.test", "UT"},
        SelectionCase{"padded_name", {{"Server", " it"}}, Selector::api, "https://api.prod.test", " it"},
        SelectionCase{"unknown_static",
                      {{"StaticContentServer", "staging"}},
                      Selector::staticContent,
                      "https://static.prod.test",
                      "staging"},
        SelectionCase{
            "not_a_string_is_nothing", {{"Server", 42}}, Selector::api, "https://api.prod.test", std::nullopt},
        SelectionCase{"custom_with_base",
                      {{"Server", "custom"}, {"CustomServer", "https://custom.test:8443"}},
                      Selector::api,
                      "https://custom.test:8443",
                      std::nullopt},
        SelectionCase{"custom_without_base_is_empty", {{"Server", "custom"}}, Selector::api, "", std::nullopt},
        SelectionCase{"custom_base_not_a_string_is_empty",
                      {{"Server", "custom"}, {"CustomServer", 8443}},
                      Selector::api,
                      "",
                      std::nullopt},
        SelectionCase{"custom_not_offered_for_static",
                      {{"StaticContentServer", "custom"}, {"CustomServer", "https://custom.test"}},
                      Selector::staticContent,
                      "https://static.prod.test",
                      "custom"},
        SelectionCase{"custom_not_offered_for_sap",
                      {{"TarvexSAPServer", "custom"}, {"CustomServer", "https://custom.test"}},
                      Selector::tarvexSAP,
                      "https://api.prod.test",
                      "custom"}),
    [](const ::testing::TestParamInfo<SelectionCase>& info) { return std::string(info.param.name); });

TEST_F(ServerSelectionTest, EachLookupLogsItsOwnFallback) {
  suite().set("Server", "UT");
  log().clear();
  EXPECT_EQ(select(Selector::api), "https://api.prod.test");
  EXPECT_EQ(select(Selector::api), "https://api.prod.test");
  EXPECT_EQ(log().count(LogLevel::Error, fallbackLine("UT")), 2) << log().dump();
}

// The suite is read at every lookup: edits act at once, with no restart and no notification.
// Two edits in quick succession between lookups, the second the same length as the value last
// read, must not be mistaken for no change at all.
TEST_F(ServerSelectionTest, EveryEditActsAtTheNextLookup) {
  for (int round = 0; round < 40; ++round) {
    suite().set("Server", "it");
    ASSERT_EQ(select(Selector::api), "https://api.it.test") << "round " << round;
    suite().set("Server", "maint");
    suite().set("Server", "ut");
    ASSERT_EQ(select(Selector::api), "https://api.ut.test") << "round " << round;
    suite().remove("Server");
    ASSERT_EQ(select(Selector::api), "https://api.prod.test") << "round " << round;
  }
}

TEST_F(ServerSelectionTest, AnUnreadableSuiteSelectsProduction) {
  suite().writeRaw("{\"Server\": \"it\",");
  EXPECT_EQ(select(Selector::api), "https://api.prod.test");
  suite().writeRaw("[\"Server\", \"it\"]");
  EXPECT_EQ(select(Selector::api), "https://api.prod.test");
  suite().set("Server", "it");
  EXPECT_EQ(select(Selector::api), "https://api.it.test");
}

// The selectors decide where the requests really go. Production's API host refuses connections
// here, so a success proves that the selected server answered.
class SelectionInRequestsTest : public NetworkTest {
 protected:
  SelectionInRequestsTest()
      : servers_([](platform::Configuration& c) {
          const std::string live = environment().baseURL();
          const std::string refused = environment().refusedURL();
          c.servers["prod"] = {live, refused};
          c.servers["it"] = {live, live};
          c.servers["ut"] = {refused, live};
          c.servers["maint"] = {live, refused};
        }) {}

 private:
  ScopedConfiguration servers_;
};

TEST_F(SelectionInRequestsTest, NamedEnvironmentsCarryTheSessionAndTheRequests) {
  suite().set("TarvexSAPServer", "it");
  suite().set("Server", "it");
  MetadataOutcome outcome = requestMetadata();
  ASSERT_FALSE(outcome.error) << outcome.error->description() << "\n" << log().dump();
  EXPECT_EQ(outcome.ppid, "PP-0001-ACCESSORY");
  EXPECT_EQ(admin().handshakes(), 1u);
}

TEST_F(SelectionInRequestsTest, ProductionIsUsedWhenTheSuiteIsEmpty) {
  expectFailure(requestMetadata(), ZLKAErrorNetwork);
  EXPECT_EQ(admin().requests("sapSession"), 0u);
}

TEST_F(SelectionInRequestsTest, CustomServerTakesTheRequests) {
  suite().set("TarvexSAPServer", "it");
  suite().set("Server", "custom");
  suite().set("CustomServer", environment().baseURL());
  ActivationOutcome outcome = requestActivation();
  ASSERT_FALSE(outcome.error) << outcome.error->description() << "\n" << log().dump();
  EXPECT_EQ(admin().requests("activateAccessory"), 1u);
}

// "custom" with no base URL gives an empty base: the request fails like a transport error.
TEST_F(SelectionInRequestsTest, CustomWithoutBaseFailsAsATransportError) {
  suite().set("TarvexSAPServer", "it");
  suite().set("Server", "custom");
  ConfirmationOutcome outcome = confirmActivation();
  expectFailure(outcome, ZLKAErrorNetwork);
  EXPECT_TRUE(log().find(LogLevel::Info, "[#TokenAuth] self._selectedAPIServer: ").has_value()) << log().dump();
  EXPECT_TRUE(log().findStartingWith("[#TokenAuth] taskError: ").has_value()) << log().dump();
  EXPECT_EQ(admin().handshakes(), 1u);  // the session itself opened on its own server
  EXPECT_EQ(admin().requests("ackAccessory"), 0u);
}

TEST_F(SelectionInRequestsTest, TheSessionFollowsTheStaticAndSAPSelections) {
  suite().set("Server", "it");
  suite().set("TarvexSAPServer", "ut");      // live API host
  suite().set("StaticContentServer", "ut");  // refused static host
  expectFailure(requestMetadata(), ZLKAErrorNetwork);
  EXPECT_EQ(admin().requests("setup.crt"), 0u);

  suite().set("StaticContentServer", "maint");  // live static host
  MetadataOutcome outcome = requestMetadata();
  ASSERT_FALSE(outcome.error) << outcome.error->description() << "\n" << log().dump();
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  EXPECT_EQ(admin().handshakes(), 1u);
}

}  // namespace
}  // namespace nettest
