// The assembled daemon as clients meet it over D-Bus: its gate, the decoding of arguments before an
// operation runs, the error names and reply shapes it answers with, a client that leaves, and the
// process's start, shutdown and idle exit. What the operations do is the network tests' business.
#include <gmock/gmock.h>
#include <signal.h>

#include <fstream>
#include <future>
#include <map>
#include <regex>
#include <thread>

#include "service/daemon_harness.h"

namespace service_test {
namespace {

using platform::Dictionary;
using testing::HasSubstr;

// A daemon that entitles this program, on an internal build so that its settings suite counts.
class Daemon : public testing::Test {
 protected:
  void SetUp() override {
    const auto file = harness.stateDirectory() / "zlkad.toml";
    const std::string config = std::regex_replace(zlkatest::readFile(file), std::regex("internal_build = false"), "internal_build = true");
    std::ofstream(file) << config;
    harness.entitleSelf();
    ASSERT_TRUE(harness.startDaemon()) << harness.daemon()->standardError();
    ASSERT_TRUE(client = harness.connect());
  }
  Harness harness;
  std::unique_ptr<ZLKAClient> client;
};

TEST_F(Daemon, TheGateRefusesACallerNoManifestEntitles) {
  auto run = zlkatest::runToEnd(
      {ZLKACTL_PATH, "--bus", harness.busAddress(), "confirm", "--token-hex", "300604015a0201010403010203", "--uuid", "U"}, harness.directory());
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.err, "zlkactl: ZLKATokenManagerErrorDomain -2: Framework client is missing entitlement.\n");
  EXPECT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})), "ok");
  EXPECT_THAT(harness.daemon()->standardError(), HasSubstr("<info> Loaded 1 entitlement manifest entr(ies)"));  // --log-level info
}

TEST_F(Daemon, ArgumentsAreDecodedBeforeTheOperationAndItsErrorsKeepTheirCodes) {
  const uint64_t requests = harness.admin().requests();
  auto raw = [&](const char* method, ZLKAClient::ArgumentWriter write) { return outcome(client->callRaw(method, write)); };
  // clang-format off
  const std::pair<std::string, std::string> refused[] = {  // the call's outcome, the refusal's message
      {raw("ConfirmActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}", 2, "token", "s", "x", "uuid", "s", "U"); }),
       "Key 'token' must hold a value of type ay."},
      {raw("RequestActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}", 1, "colour", "s", "blue"); }), "Unknown key 'colour'."},
      // Only the metadata request takes a locale.
      {raw("RequestActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}", 1, "requestedLocale", "s", "en_US"); }),
       "Unknown key 'requestedLocale'."},
      {raw("ConfirmActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "a{sv}", 2, "uuid", "s", "A", "uuid", "s", "B"); }),
       "Key 'uuid' is given twice."},
      // Tokens are tens of bytes; a larger one would grow about 120-fold on its way to the server.
      {outcome(client->confirmActivation({platform::Data(std::vector<uint8_t>(64 * 1024 + 1))})), "Key 'token' must hold at most 65536 bytes."},
      {raw("ConfirmActivationForToken", [](sd_bus_message* m) { return sd_bus_message_append(m, "s", "x"); }),
       "Invalid arguments 's' to call com.kestro.ZLKAuthentication.ZLKANetworkProtocol.ConfirmActivationForToken(), expecting 'a{sv}'."},
  };
  // clang-format on
  for (const auto& [got, message] : refused)
    EXPECT_EQ(got, "ZLKAClientErrorDomain 4: The call was refused with org.freedesktop.DBus.Error.InvalidArgs: " + message);
  EXPECT_EQ(harness.admin().requests(), requests);

  const std::string failed = "ZLKATokenManagerErrorDomain ";
  EXPECT_EQ(outcome(client->confirmActivation({})), failed + "-3: An invalid parameter was provided by the caller.");
  // Bytes are a value that JSON cannot hold.
  EXPECT_EQ(outcome(client->requestMetadata({sampleToken(), "U", "en_US", Dictionary{{"b", platform::Data::fromString("x")}}})),
            failed + "-4: An internal error has occurred.");
  harness.admin().setFault({{"endpoint", "activateAccessory"}, {"status", 500}});
  EXPECT_EQ(outcome(client->requestActivation({sampleToken(), "U"})), failed + "-6: An internal server error has occurred.");
  // A string that D-Bus cannot carry whole is a bad answer, not a silently shortened one.
  harness.admin().setFault({{"endpoint", "queryProductPlan"}, {"body", std::string(R"({"ppid":"PP\u0000-1","locale":"en_US","ppid_metadata":{}})")}});
  EXPECT_EQ(outcome(client->requestMetadata({sampleToken(), "U", "en_US"})), failed + "-6: An internal server error has occurred.");
  EXPECT_THAT(harness.daemon()->standardError(), HasSubstr("The answer's ppid cannot be sent over D-Bus"));
  // Honoured only because the configuration declares an internal build.
  platform::SettingsStore("com.kestro.ZLKAuthentication", harness.stateDirectory() / "defaults").setObject("ForceNetworkFailure", true);
  EXPECT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})), failed + "-5: There was a problem connecting to the network.");
}

TEST_F(Daemon, AnswersInTheOperationsShapesAndOutlivesAClientThatLeavesMidCall) {
  // The client takes no answer of another signature than sss, ay and nothing.
  EXPECT_EQ(outcome(client->requestMetadata({sampleToken(), "U", "fr_FR", Dictionary{{"source", "test"}}})), "ok");
  auto activation = client->requestActivation({sampleToken(), "U"});
  ASSERT_EQ(outcome(activation), "ok");
  EXPECT_EQ(activation.value().bytes()[0], 0x30);  // the server's record leads the new token
  EXPECT_EQ(outcome(client->confirmActivation({activation.value(), "U"})), "ok");

  harness.admin().setFault({{"endpoint", "ackAccessory"}, {"delay_ms", 300}, {"remaining", 2}});
  const uint64_t acks = harness.admin().requests("ackAccessory");
  {
    auto leaving = harness.connect();
    leaving->confirmActivationAsync({sampleToken(), "U"}, [](auto) {});
    for (int i = 0; i < 500 && harness.admin().requests("ackAccessory") == acks; ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }  // gone from the bus while the server holds its call; the next call is held as long, so it ends after
  EXPECT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})), "ok");
  EXPECT_FALSE(harness.daemon()->waitExit(std::chrono::milliseconds(0)));
}

TEST_F(Daemon, SigtermAnswersEveryCallInFlight) {
  ASSERT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})), "ok");  // so that none waits for the session
  harness.admin().setFault({{"endpoint", "ackAccessory"}, {"delay_ms", 400}});
  std::vector<std::promise<std::string>> answers(8);
  for (auto& answer : answers)
    client->confirmActivationAsync({sampleToken(), "U"}, [&answer](auto r) {
      const std::string got = outcome(r);
      const bool gone = got.find("(org.freedesktop.DBus.Error.NoServer") != std::string::npos ||
                        got.find("(org.freedesktop.DBus.Error.ServiceUnknown") != std::string::npos;
      answer.set_value(gone ? "gone" : got);
    });
  for (int i = 0; i < 500 && harness.admin().requests("ackAccessory") < 2; ++i) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  harness.daemon()->signal(SIGTERM);
  std::map<std::string, int> outcomes;
  for (auto& answer : answers) {
    auto future = answer.get_future();
    ASSERT_EQ(future.wait_for(std::chrono::minutes(1)), std::future_status::ready);
    ++outcomes[future.get()];
  }
  // Those in flight complete; those that had not reached the daemon find it gone from the bus
  // (the bus answers NoServer, or ServiceUnknown for a call sent after the name was released).
  EXPECT_GE(outcomes["ok"], 1);
  EXPECT_EQ(outcomes["ok"] + outcomes["gone"], 8) << testing::PrintToString(outcomes);
  EXPECT_EQ(harness.daemon()->waitExit(std::chrono::seconds(30)), 0);
  EXPECT_THAT(harness.daemon()->standardError(), HasSubstr("Shutting down (SIGTERM)"));
}

TEST(DaemonProcess, ABadStartIsRefusedNamingWhatIsWrong) {
  Harness harness;
  const auto config = harness.stateDirectory() / "zlkad.toml";
  std::ofstream(harness.directory() / "anchor.toml") << std::regex_replace(zlkatest::readFile(config), std::regex("sap-root.pem"), "zlkad.toml");
  const std::tuple<std::string, std::string, int, const char*> rows[] = {
      {"--config", (harness.directory() / "anchor.toml").string(), 1, "anchor.toml: sap.trust_anchor: "},  // not a certificate
      {"--config", (harness.directory() / "absent.toml").string(), 1, "absent.toml"},
      {"--log-level", "loud", 2, "--log-level"},  // a usage error
  };
  for (const auto& [option, value, status, mention] : rows) {
    auto run = zlkatest::runToEnd({ZLKAD_PATH, "--bus", harness.busAddress(), option, value}, harness.directory());
    EXPECT_EQ(run.status, status) << run.err;
    EXPECT_THAT(run.err, HasSubstr(mention));
  }
}

TEST(DaemonProcess, ExitsOnIdleWhenAsked) {
  Harness harness;
  ASSERT_TRUE(harness.startDaemon({"--exit-on-idle", "1"}));
  EXPECT_EQ(harness.daemon()->waitExit(std::chrono::seconds(20)), 0);
  EXPECT_THAT(harness.daemon()->standardError(), HasSubstr("Shutting down (idle)"));
}

}  // namespace
}  // namespace service_test
