// The assembled daemon as clients meet it over D-Bus: the gate it applies, the decoding of
// arguments before an operation runs, the errors and reply shapes it answers with, clients that
// come and go, and the process's start, shutdown and idle exit.
#include <gmock/gmock.h>

#include <fstream>
#include <future>
#include <map>
#include <regex>

#include "client/zlka_client.h"
#include "service/daemon_harness.h"

using platform::Array;
using platform::Dictionary;
using platform::Value;
using service_test::Harness;
using service_test::sampleToken;
using testing::HasSubstr;
using zlka_client::ZLKAClient;

namespace {

std::unique_ptr<ZLKAClient> connect(Harness& harness) {
  auto made = ZLKAClient::connect({.bus = harness.busAddress()});
  return made.ok() ? std::move(made).value() : nullptr;
}

template <class T>
std::string outcome(const zlka_client::Result<T>& r) {
  return r.ok() ? "ok" : r.error().domain() + " " + std::to_string(r.error().code()) + ": " + r.error().localizedDescription();
}

// One daemon for the suite, entitling this test program and one copy of zlkactl.
class Daemon : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    harness = new Harness();
    harness->writeManifest("self", std::filesystem::read_symlink("/proc/self/exe").string(), Value(Array{"token-auth"}));
    harness->writeManifest("entitled", harness->copyOfZlkactl("entitled"), Value(Array{"token-auth"}));
    harness->writeManifest("writable", harness->copyOfZlkactl("writable"), Value(Array{"token-auth"}), 0666);
    harness->copyOfZlkactl("unentitled");
    ASSERT_TRUE(harness->startDaemon()) << harness->daemon()->standardError();
  }
  static void TearDownTestSuite() { delete harness; }
  void SetUp() override { ASSERT_TRUE(client = connect(*harness)); }

  static inline Harness* harness = nullptr;
  std::unique_ptr<ZLKAClient> client;
};

TEST_F(Daemon, TheGateAdmitsAnEntitledCallerAndRefusesOthers) {
  const std::pair<const char*, const char*> rows[] = {
      {"entitled", ""},
      {"unentitled", "zlkactl: ZLKATokenManagerErrorDomain -2: Framework client is missing entitlement.\n"},
      {"writable", "zlkactl: ZLKATokenManagerErrorDomain -2: "},  // its manifest is ignored
  };
  for (const auto& [name, err] : rows) {
    auto run = service_test::runToEnd({(harness->directory() / "clients" / name / "zlkactl").string(), "--bus",
                                       harness->busAddress(), "confirm", "--token-hex", "300604015a0201010403010203", "--uuid", "U"},
                                      harness->directory());
    EXPECT_EQ(run.status, *err ? 1 : 0) << name << ": " << run.err;
    EXPECT_THAT(run.err, testing::StartsWith(err)) << name;
  }
  // Refused before its missing arguments are noticed.
  auto bare = service_test::runToEnd({(harness->directory() / "clients/unentitled/zlkactl").string(), "--bus",
                                      harness->busAddress(), "confirm"}, harness->directory());
  EXPECT_THAT(bare.err, HasSubstr("-2: "));
  EXPECT_THAT(harness->daemon()->standardError(), HasSubstr("writable.json: it is writable by group or others"));
  EXPECT_THAT(harness->daemon()->standardError(), HasSubstr("<info> Loaded 2 entitlement manifest entr(ies)"));  // --log-level info
}

TEST_F(Daemon, ArgumentsAreCheckedBeforeTheOperationAndItsErrorsKeepTheirCodes) {
  auto raw = [](const char* method, ZLKAClient::ArgumentWriter write) {
    return [=](ZLKAClient& c) { return outcome(c.callRaw(method, write)); };
  };
  const uint64_t tokenRequests = harness->admin().requests();
  const std::string invalid = "ZLKAClientErrorDomain 4: The call was refused with org.freedesktop.DBus.Error.InvalidArgs: ";
  // clang-format off
  const std::pair<std::function<std::string(ZLKAClient&)>, std::string> refused[] = {
      {raw("ConfirmActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}", 2, "token", "s", "x", "uuid", "s", "U"); }),
       "Key 'token' must hold a value of type ay."},
      {raw("RequestActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}", 1, "colour", "s", "blue"); }), "Unknown key 'colour'."},
      // Only the metadata request takes a locale.
      {raw("RequestActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}", 1, "requestedLocale", "s", "en_US"); }),
       "Unknown key 'requestedLocale'."},
      {raw("ConfirmActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}", 2, "uuid", "s", "A", "uuid", "s", "B"); }),
       "Key 'uuid' is given twice."},
      {raw("ConfirmActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "s", "x"); }),
       "Invalid arguments 's' to call com.kestro.ZLKAuthentication.ZLKANetworkProtocol.ConfirmActivationForToken(), expecting 'a{sv}'."},
  };
  const std::tuple<nlohmann::json, std::function<std::string(ZLKAClient&)>, std::string> failed[] = {
      {{}, [](ZLKAClient& c) { return outcome(c.confirmActivation({})); }, "-3: An invalid parameter was provided by the caller."},
      // Bytes are a value that JSON cannot hold.
      {{}, [](ZLKAClient& c) { return outcome(c.requestMetadata({sampleToken(), "U", "en_US", Dictionary{{"b", platform::Data::fromString("x")}}})); },
       "-4: An internal error has occurred."},
      {{{"endpoint", "ackAccessory"}, {"drop", true}}, [](ZLKAClient& c) { return outcome(c.confirmActivation({sampleToken(), "U"})); },
       "-5: There was a problem connecting to the network."},
      {{{"endpoint", "activateAccessory"}, {"status", 500}}, [](ZLKAClient& c) { return outcome(c.requestActivation({sampleToken(), "U"})); },
       "-6: An internal server error has occurred."},
  };
  // clang-format on
  for (const auto& [call, message] : refused) EXPECT_EQ(call(*client), invalid + message);
  EXPECT_EQ(harness->admin().requests(), tokenRequests);
  for (const auto& [fault, call, message] : failed) {
    if (!fault.is_null()) harness->admin().setFault(fault);
    EXPECT_EQ(call(*client), "ZLKATokenManagerErrorDomain " + message);
    harness->admin().clearFaults();
  }
}

TEST_F(Daemon, TheOperationsAnswerInTheShapesTheShippedInterfaceDescribes) {
  // The client takes no answer of another signature than sss, ay and nothing.
  EXPECT_EQ(outcome(client->requestMetadata({sampleToken(), "U", "fr_FR", Dictionary{{"source", "test"}}})), "ok");
  auto activation = client->requestActivation({sampleToken(), "U"});
  ASSERT_EQ(outcome(activation), "ok");
  EXPECT_EQ(activation.value().bytes()[0], 0x30);  // the server's record leads the new token
  EXPECT_EQ(outcome(client->confirmActivation({activation.value(), "U"})), "ok");

  std::ifstream in(std::string(DIST_DIR) + "/com.kestro.ZLKAuthentication.ZLKANetworkProtocol.xml");
  std::string xml((std::istreambuf_iterator<char>(in)), {});
  auto live = service_test::runToEnd({"/usr/bin/busctl", "--address=" + harness->busAddress(), "introspect",
                                      "com.kestro.ZLKAuthentication.ZLKANetwork", "/com/kestro/ZLKAuthentication/ZLKANetwork",
                                      "com.kestro.ZLKAuthentication.ZLKANetworkProtocol"},
                                     harness->directory());
  for (const auto& [name, signature] :
       {std::pair{"RequestMetadataForToken", "sss"}, {"RequestActivationForToken", "ay"}, {"ConfirmActivationForToken", "-"}}) {
    EXPECT_TRUE(std::regex_search(live.out, std::regex(std::string("\\.") + name + "\\s+method\\s+a\\{sv\\}\\s+" + signature)))
        << live.out << live.err;
    EXPECT_THAT(xml, HasSubstr(std::string("<method name=\"") + name + "\">"));
  }
}

TEST_F(Daemon, ClientsComeAndGoWithoutDisturbingOneAnother) {
  ASSERT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})), "ok");  // the session is open from here on
  harness->admin().setFault({{"endpoint", "ackAccessory"}, {"delay_ms", 300}, {"remaining", 1}});
  {
    auto leaving = connect(*harness);
    const uint64_t acks = harness->admin().requests("ackAccessory");
    leaving->confirmActivationAsync({sampleToken(), "U"}, [](auto) {});
    for (int i = 0; i < 500 && harness->admin().requests("ackAccessory") == acks; ++i)
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }  // gone from the bus while the server holds its call
  auto other = connect(*harness);
  std::promise<std::string> first, second;
  client->confirmActivationAsync({sampleToken(), "A"}, [&](auto r) { first.set_value(outcome(r)); });
  other->confirmActivationAsync({sampleToken(), "B"}, [&](auto r) { second.set_value(outcome(r)); });
  for (auto* answer : {&first, &second}) {
    auto future = answer->get_future();
    ASSERT_EQ(future.wait_for(std::chrono::minutes(1)), std::future_status::ready);
    EXPECT_EQ(future.get(), "ok");
  }
  EXPECT_EQ(harness->admin().handshakes(), 1u);  // every client shares the daemon's one session
  EXPECT_FALSE(harness->daemon()->waitExit(std::chrono::milliseconds(0)));
}

TEST(DaemonProcess, ABadStartIsRefusedNamingWhatIsWrong) {
  Harness harness;
  std::ifstream in(harness.configFile());
  std::string text((std::istreambuf_iterator<char>(in)), {});
  std::ofstream(harness.directory() / "broken.toml") << std::regex_replace(text, std::regex("api = \"https:"), "api = \"http:");
  std::ofstream(harness.directory() / "anchor.toml") << std::regex_replace(text, std::regex("sap-root.pem"), "zlkad.toml");
  const std::pair<std::vector<std::string>, std::vector<const char*>> rows[] = {
      {{"--config", (harness.directory() / "broken.toml").string()}, {"broken.toml", "servers.prod.api"}},
      {{"--config", (harness.directory() / "anchor.toml").string()}, {"anchor.toml", "sap.trust_anchor"}},  // not a certificate
      {{"--config", (harness.directory() / "absent.toml").string()}, {"absent.toml"}},
      {{"--log-level", "loud"}, {"--log-level"}},  // a usage error: 2
  };
  for (const auto& [arguments, mentions] : rows) {
    std::vector<std::string> argv = {ZLKAD_PATH, "--bus", harness.busAddress()};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    auto run = service_test::runToEnd(argv, harness.directory());
    EXPECT_EQ(run.status, arguments[0] == "--config" ? 1 : 2) << run.err;
    for (const char* mention : mentions) EXPECT_THAT(run.err, HasSubstr(mention));
  }
}

TEST(DaemonProcess, SigtermAnswersEveryCallInFlight) {
  Harness harness;
  harness.writeManifest("self", std::filesystem::read_symlink("/proc/self/exe").string(), Value(Array{"token-auth"}));
  ASSERT_TRUE(harness.startDaemon());
  auto client = connect(harness);
  ASSERT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})), "ok");  // so that none waits for an open
  harness.admin().setFault({{"endpoint", "ackAccessory"}, {"delay_ms", 400}});
  std::vector<std::promise<std::string>> answers(8);
  for (auto& answer : answers) {
    client->confirmActivationAsync({sampleToken(), "U"}, [&answer](auto r) {
      answer.set_value(outcome(r).find("(org.freedesktop.DBus.Error.NoServer") != std::string::npos ? "gone" : outcome(r));
    });
  }
  for (int i = 0; i < 500 && harness.admin().requests("ackAccessory") < 2; ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  harness.daemon()->signal(SIGTERM);
  std::map<std::string, int> outcomes;
  for (auto& answer : answers) {
    auto future = answer.get_future();
    ASSERT_EQ(future.wait_for(std::chrono::minutes(1)), std::future_status::ready);
    ++outcomes[future.get()];
  }
  // Those in flight complete; those that had not reached the daemon find it gone from the bus.
  EXPECT_GE(outcomes["ok"], 1);
  EXPECT_EQ(outcomes["ok"] + outcomes["gone"], 8) << testing::PrintToString(outcomes);
  EXPECT_EQ(harness.daemon()->waitExit(std::chrono::seconds(30)), 0);
  EXPECT_THAT(harness.daemon()->standardError(), HasSubstr("Shutting down (SIGTERM)"));
}

TEST(DaemonProcess, ExitsOnIdleWhenAsked) {
  Harness harness;
  ASSERT_TRUE(harness.startDaemon({"--exit-on-idle", "1"}));
  EXPECT_EQ(harness.daemon()->waitExit(std::chrono::seconds(20)), 0);
  EXPECT_THAT(harness.daemon()->standardError(), HasSubstr("Shutting down (idle)"));
}

}  // namespace
