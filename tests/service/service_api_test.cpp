// The daemon as clients meet it: one daemon for the suite, clients of several identities.
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <future>
#include <regex>

#include "client/zlka_client.h"
#include "platform/json.h"
#include "service/daemon_harness.h"

using platform::Array;
using platform::Dictionary;
using platform::Value;
using service_test::Harness;
using zlka_client::ZLKAClient;

namespace {

std::string selfExecutable() { return std::filesystem::read_symlink("/proc/self/exe").string(); }

std::string hexOf(const platform::Data& d) {
  static const char digits[] = "0123456789abcdef";
  std::string out;
  for (uint8_t b : d.span()) {
    out += digits[b >> 4];
    out += digits[b & 15];
  }
  return out;
}

// Entitlement values of the clients the gate must admit or refuse, each a zlkactl of its own path.
struct GateCase {
  const char* name;
  std::optional<Value> value;  // nullopt: no manifest at all
  bool admitted;
};

const GateCase kGateCases[] = {
    {"array-with-category", Value(Array{"other", "token-auth"}), true},
    {"array-other-string", Value(Array{"other"}), false},
    {"empty-array", Value(Array{}), false},
    {"bare-true", Value(true), false},
    {"plain-string", Value("token-auth"), false},
    {"dictionary-true", Value(Dictionary{{"token-auth", true}}), true},
    {"dictionary-number", Value(Dictionary{{"token-auth", 1}}), true},
    {"dictionary-false", Value(Dictionary{{"token-auth", false}}), false},
    {"dictionary-string", Value(Dictionary{{"token-auth", "yes"}}), false},
    {"dictionary-other-key", Value(Dictionary{{"other", true}}), false},
    {"no-entitlement", std::nullopt, false},
};

class ServiceAPI : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    harness = new Harness();
    harness->writeManifest("self", selfExecutable(), Value(Array{"token-auth"}));
    for (const GateCase& c : kGateCases) {
      std::string path = harness->copyOfZlkactl(c.name);
      if (c.value) harness->writeManifest(c.name, path, *c.value);
    }
    std::string loose = harness->copyOfZlkactl("writable-manifest");
    harness->writeManifest("writable-manifest", loose, Value(Array{"token-auth"}), 0666);
    ASSERT_TRUE(harness->startDaemon()) << harness->daemon()->standardError();
  }
  static void TearDownTestSuite() {
    delete harness;
    harness = nullptr;
  }
  void SetUp() override {
    harness->clearFaults();
    auto made = ZLKAClient::connect({.bus = harness->busAddress()});
    ASSERT_TRUE(made.ok()) << made.error().description();
    client = std::move(made).value();
  }

  service_test::RunResult runClient(const std::string& name, const std::vector<std::string>& arguments) {
    std::vector<std::string> argv = {(harness->directory() / "clients" / name / "zlkactl").string(), "--bus", harness->busAddress()};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return service_test::runToEnd(argv, harness->directory());
  }

  static Harness* harness;
  std::unique_ptr<ZLKAClient> client;
};

Harness* ServiceAPI::harness = nullptr;

}  // namespace

TEST_F(ServiceAPI, AnEntitledClientRunsTheThreeOperations) {
  auto metadata = client->requestMetadata({.token = service_test::sampleToken(), .uuid = "UUID-1", .requestedLocale = "fr_FR",
                                           .requestInfo = Dictionary{{"source", "test"}, {"nested", Dictionary{{"n", 1}}}}});
  ASSERT_TRUE(metadata.ok()) << metadata.error().description();
  EXPECT_FALSE(metadata.value().ppid.empty());
  EXPECT_EQ(metadata.value().locale, "fr_FR");
  EXPECT_TRUE(metadata.value().metadata.isDictionary());

  auto activation = client->requestActivation({.token = service_test::sampleToken(), .uuid = "UUID-1"});
  ASSERT_TRUE(activation.ok()) << activation.error().description();
  const platform::Data& newToken = activation.value();
  ASSERT_GT(newToken.length(), 2u);
  EXPECT_EQ(newToken.bytes()[0], 0x30);  // the server's record leads the replacement token

  auto confirmation = client->confirmActivation({.token = newToken, .uuid = "UUID-1"});
  EXPECT_TRUE(confirmation.ok()) << confirmation.error().description();
}

TEST_F(ServiceAPI, TheGateAdmitsExactlyTheCategoryHolders) {
  std::string token = hexOf(service_test::sampleToken());
  for (const GateCase& c : kGateCases) {
    auto result = runClient(c.name, {"confirm", "--token-hex", token, "--uuid", "U"});
    if (c.admitted) {
      EXPECT_EQ(result.status, 0) << c.name << ": " << result.err;
    } else {
      EXPECT_NE(result.status, 0) << c.name;
      EXPECT_NE(result.err.find("-2"), std::string::npos) << c.name << ": " << result.err;
    }
  }
}

TEST_F(ServiceAPI, AManifestWritableByOthersIsIgnored) {
  auto result = runClient("writable-manifest", {"confirm", "--token-hex", hexOf(service_test::sampleToken()), "--uuid", "U"});
  EXPECT_NE(result.status, 0);
  EXPECT_NE(result.err.find("-2"), std::string::npos) << result.err;
  EXPECT_NE(harness->daemon()->standardError().find("writable-manifest.json: it is writable by group or others"), std::string::npos);
}

TEST_F(ServiceAPI, AbsentArgumentsAreInvalidUnlessTheCallerIsNotEntitled) {
  auto confirm = client->confirmActivation({});
  ASSERT_FALSE(confirm.ok());
  EXPECT_EQ(confirm.error().domain(), "ZLKATokenManagerErrorDomain");
  EXPECT_EQ(confirm.error().code(), -3);
  auto metadata = client->requestMetadata({.token = service_test::sampleToken(), .uuid = "U"});  // no locale
  ASSERT_FALSE(metadata.ok());
  EXPECT_EQ(metadata.error().code(), -3);
  EXPECT_EQ(metadata.error().localizedDescription(), "An invalid parameter was provided by the caller.");

  auto unentitled = runClient("no-entitlement", {"confirm"});
  EXPECT_NE(unentitled.status, 0);
  EXPECT_NE(unentitled.err.find("-2"), std::string::npos) << unentitled.err;
}

TEST_F(ServiceAPI, WrongTypesAndUnknownKeysAreRefusedBeforeTheOperation) {
  auto tokenRequests = [] {
    const Value stats = harness->stats();
    const Value* requests = stats.find("requests");
    double n = 0;
    for (const char* endpoint : {"queryProductPlan", "activateAccessory", "ackAccessory"})
      if (const Value* count = requests ? requests->find(endpoint) : nullptr) n += count->numberValue().value_or(0);
    return n;
  };
  const double before = tokenRequests();
  auto wrongType = client->callRaw("ConfirmActivationForToken", [](sd_bus_message* m) {
    return sd_bus_message_append(m, "a{sv}", 2, "token", "s", "not bytes", "uuid", "s", "U");
  });
  ASSERT_FALSE(wrongType.ok());
  ASSERT_TRUE(wrongType.error().userInfo());
  EXPECT_EQ(*wrongType.error().userInfo()->at("DBusErrorName").string(), "org.freedesktop.DBus.Error.InvalidArgs");
  EXPECT_NE(wrongType.error().userInfo()->at("DBusErrorMessage").string()->find("'token'"), std::string::npos);

  auto unknownKey = client->callRaw("RequestActivationForToken", [](sd_bus_message* m) {
    return sd_bus_message_append(m, "a{sv}", 1, "colour", "s", "blue");
  });
  ASSERT_FALSE(unknownKey.ok());
  EXPECT_NE(unknownKey.error().userInfo()->at("DBusErrorMessage").string()->find("'colour'"), std::string::npos);

  auto wrongSignature = client->callRaw("ConfirmActivationForToken", [](sd_bus_message* m) {
    return sd_bus_message_append(m, "s", "not a dictionary");
  });
  ASSERT_FALSE(wrongSignature.ok());
  EXPECT_EQ(*wrongSignature.error().userInfo()->at("DBusErrorName").string(), "org.freedesktop.DBus.Error.InvalidArgs");
  EXPECT_EQ(tokenRequests(), before);  // nothing reached the server
}

TEST_F(ServiceAPI, RequestInfoThatJSONCannotHoldFailsAsInternal) {
  auto metadata = client->requestMetadata({.token = service_test::sampleToken(), .uuid = "U", .requestedLocale = "en_US",
                                           .requestInfo = Dictionary{{"blob", platform::Data::fromString("raw")}}});
  ASSERT_FALSE(metadata.ok());
  EXPECT_EQ(metadata.error().code(), -4);
}

TEST_F(ServiceAPI, ServerFailuresComeBackWithTheirCodes) {
  harness->setFault(R"({"endpoint": "ackAccessory", "status": 400, "remaining": 1})");
  auto badRequest = client->confirmActivation({.token = service_test::sampleToken(), .uuid = "U"});
  ASSERT_FALSE(badRequest.ok());
  EXPECT_EQ(badRequest.error().code(), -3);
  harness->setFault(R"({"endpoint": "activateAccessory", "status": 500, "remaining": 1})");
  auto serverError = client->requestActivation({.token = service_test::sampleToken(), .uuid = "U"});
  ASSERT_FALSE(serverError.ok());
  EXPECT_EQ(serverError.error().code(), -6);
  EXPECT_EQ(serverError.error().localizedDescription(), "An internal server error has occurred.");
}

TEST_F(ServiceAPI, AClientThatLeavesMidRequestDoesNotDisturbTheDaemon) {
  harness->setFault(R"({"endpoint": "ackAccessory", "delay_ms": 300, "remaining": 1})");
  {
    auto leaving = ZLKAClient::connect({.bus = harness->busAddress()});
    ASSERT_TRUE(leaving.ok());
    leaving.value()->confirmActivationAsync({.token = service_test::sampleToken(), .uuid = "U"}, [](auto) {});
    // Destroyed here, with the call unanswered: its connection leaves the bus.
  }
  auto confirmation = client->confirmActivation({.token = service_test::sampleToken(), .uuid = "U"});
  EXPECT_TRUE(confirmation.ok()) << confirmation.error().description();
  EXPECT_FALSE(harness->daemon()->waitExit(std::chrono::milliseconds(0)).has_value());
}

TEST_F(ServiceAPI, TwoClientsAtOnceReachTheSameService) {
  auto other = ZLKAClient::connect({.bus = harness->busAddress()});
  ASSERT_TRUE(other.ok());
  std::promise<bool> first, second;
  client->confirmActivationAsync({.token = service_test::sampleToken(), .uuid = "A"}, [&](auto r) { first.set_value(r.ok()); });
  other.value()->confirmActivationAsync({.token = service_test::sampleToken(), .uuid = "B"},
                                        [&](auto r) { second.set_value(r.ok()); });
  auto f = first.get_future(), s = second.get_future();
  ASSERT_EQ(f.wait_for(std::chrono::seconds(60)), std::future_status::ready);
  ASSERT_EQ(s.wait_for(std::chrono::seconds(60)), std::future_status::ready);
  // Both answered; at most one of them can have found the session still opening.
  EXPECT_TRUE(f.get() || s.get());
  // Both went through one shared client object: one session, one handshake for the suite.
  EXPECT_EQ(harness->stats().find("handshakes")->numberValue(), 1.0);
}

TEST_F(ServiceAPI, TheLiveInterfaceMatchesTheShippedDescription) {
  auto xml = [] {
    std::ifstream in(std::string(DIST_DIR) + "/com.kestro.ZLKAuthentication.ZLKANetworkProtocol.xml");
    return std::string((std::istreambuf_iterator<char>(in)), {});
  }();
  auto live = service_test::runToEnd({"/usr/bin/busctl", "--address=" + harness->busAddress(), "introspect",
                                      "com.kestro.ZLKAuthentication.ZLKANetwork", "/com/kestro/ZLKAuthentication/ZLKANetwork",
                                      "com.kestro.ZLKAuthentication.ZLKANetworkProtocol"},
                                     harness->directory());
  ASSERT_EQ(live.status, 0) << live.err;
  const std::pair<const char*, const char*> methods[] = {
      {"RequestMetadataForToken", "a\\{sv\\}\\s+sss"},
      {"RequestActivationForToken", "a\\{sv\\}\\s+ay"},
      {"ConfirmActivationForToken", "a\\{sv\\}\\s+-"}};
  for (const auto& [name, signature] : methods) {
    EXPECT_TRUE(std::regex_search(live.out, std::regex(std::string("\\.") + name + "\\s+method\\s+" + signature))) << live.out;
    EXPECT_NE(xml.find(std::string("<method name=\"") + name + "\">"), std::string::npos) << name;
  }
}
