// The assembled daemon as clients meet it over D-Bus: its gate, the decoding of arguments before an
// operation runs, the error names and reply shapes it answers with, a client that leaves, and the
// process's start, shutdown and idle exit. What the operations do is the network tests' business.
#include <gmock/gmock.h>
#include <pwd.h>
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

// The members of `interface` in introspection XML, one line each ("arg ppid s out"), without the
// annotations: what the file in dist/ promises, or what the daemon serves.
std::vector<std::string> members(const std::string& xml, const std::string& interface) {
  const size_t start = xml.find("<interface name=\"" + interface + "\"");
  if (start == std::string::npos) return {};
  const std::string body = xml.substr(start, xml.find("</interface>", start) - start);
  const std::regex element(R"(<(method|property|signal|arg)\s([^>]*)>)"), attribute(R"re((\w+)="([^"]*)")re");
  std::vector<std::string> out;
  for (std::sregex_iterator e(body.begin(), body.end(), element), end; e != end; ++e) {
    std::map<std::string, std::string> a;
    const std::string attributes = (*e)[2];
    for (std::sregex_iterator i(attributes.begin(), attributes.end(), attribute); i != end; ++i) a[(*i)[1]] = (*i)[2];
    out.push_back((*e)[1].str() + " " + a["name"] + " " + a["type"] + " " + a["direction"] + a["access"]);
  }
  return out;
}

// A daemon that entitles this program, on an internal build so that its settings suite counts.
class Daemon : public testing::Test {
 protected:
  void SetUp() override {
    const auto file = harness.stateDirectory() / "zlkad.toml";
    const std::string config =
        std::regex_replace(zlkatest::readFile(file), std::regex("internal_build = false"), "internal_build = true");
    std::ofstream(file) << config;
    harness.entitleSelf();
    ASSERT_TRUE(harness.startDaemon()) << harness.daemon()->standardError();
    ASSERT_TRUE(client = harness.connect());
  }
  Harness harness;
  std::unique_ptr<ZLKAClient> client;
};

TEST_F(Daemon, TheGateRefusesACallerNoManifestEntitles) {
  auto run = zlkatest::runToEnd({ZLKACTL_PATH, "--bus", harness.busAddress(), "confirm", "--token-hex",
                                 "300604015a0201010403010203", "--uuid", "U"},
                                harness.directory());
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.err, "zlkactl: ZLKATokenManagerErrorDomain -2: Framework client is missing entitlement.\n");
  EXPECT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})), "ok");
  EXPECT_THAT(harness.daemon()->standardError(),
              HasSubstr("<info> Loaded 1 entitlement manifest entr(ies)"));  // --log-level info
}

TEST_F(Daemon, ArgumentsAreDecodedBeforeTheOperationAndItsErrorsKeepTheirCodes) {
  const uint64_t requests = harness.admin().requests();
  auto raw = [&](const char* method, ZLKAClient::ArgumentWriter write) {
    return outcome(client->callRaw(method, write));
  };
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
    EXPECT_EQ(got,
              "ZLKAClientErrorDomain 4: The call was refused with org.freedesktop.DBus.Error.InvalidArgs: " + message);
  EXPECT_EQ(harness.admin().requests(), requests);

  const std::string failed = "ZLKATokenManagerErrorDomain ";
  EXPECT_EQ(outcome(client->confirmActivation({})), failed + "-3: An invalid parameter was provided by the caller.");
  // Bytes are a value that JSON cannot hold.
  EXPECT_EQ(outcome(client->requestMetadata(
                {sampleToken(), "U", "en_US", Dictionary{{"b", platform::Data::fromString("x")}}})),
            failed + "-4: An internal error has occurred.");
  harness.admin().setFault({{"endpoint", "activateAccessory"}, {"status", 500}});
  EXPECT_EQ(outcome(client->requestActivation({sampleToken(), "U"})),
            failed + "-6: An internal server error has occurred.");
  // A string that D-Bus cannot carry whole is a bad answer, not a silently shortened one.
  harness.admin().setFault({{"endpoint", "queryProductPlan"},
                            {"body", std::string(R"({"ppid":"PP\u0000-1","locale":"en_US","ppid_metadata":{}})")}});
  EXPECT_EQ(outcome(client->requestMetadata({sampleToken(), "U", "en_US"})),
            failed + "-6: An internal server error has occurred.");
  EXPECT_THAT(harness.daemon()->standardError(), HasSubstr("The answer's ppid cannot be sent over D-Bus"));
  // Honoured only because the configuration declares an internal build.
  platform::SettingsStore("com.kestro.ZLKAuthentication", harness.stateDirectory() / "defaults")
      .setObject("ForceNetworkFailure", true);
  EXPECT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})),
            failed + "-5: There was a problem connecting to the network.");
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
    for (int i = 0; i < 500 && harness.admin().requests("ackAccessory") == acks; ++i)
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
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
  for (int i = 0; i < 500 && harness.admin().requests("ackAccessory") < 2; ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
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

TEST(DaemonProcess, ABadStartOrCheckIsRefusedNamingWhatIsWrong) {
  Harness harness(/*anyUser=*/true);  // so that a check may run as another user
  const auto dir = harness.directory();
  const std::string config = (harness.stateDirectory() / "zlkad.toml").string();
  auto variant = [&](const std::string& name, const std::string& from, const std::string& to) {
    std::ofstream(dir / name) << std::regex_replace(zlkatest::readFile(config), std::regex(from), to);
    return (dir / name).string();
  };
  std::filesystem::create_directory(dir / "bad-manifests");
  std::ofstream(dir / "bad-manifests" / "nobody.json") << "{}";  // pins no user
  std::ofstream(dir / "secret.toml") << zlkatest::readFile(config);
  std::filesystem::permissions(dir / "secret.toml", std::filesystem::perms::none);
  // Root reads any file: the permission row runs as nobody then.
  std::vector<std::string> asNobody;
  if (const passwd* p = getpwnam("nobody"); geteuid() == 0 && p)
    asNobody = {"/usr/bin/setpriv", "--reuid=" + std::to_string(p->pw_uid), "--regid=" + std::to_string(p->pw_gid),
                "--clear-groups"};
  const std::string bus = harness.busAddress(), noBus = "unix:path=/nonexistent";  // a check never connects
  struct Row {
    const char* name;
    std::vector<std::string> arguments;
    int status;
    std::string mention;
  };
  // clang-format off
  const Row rows[] = {
      {"anchor_not_a_certificate", {"--bus", bus, "--config", variant("anchor.toml", "sap-root.pem", "zlkad.toml")}, 78,
       "anchor.toml: sap.trust_anchor: " + (dir / "state" / "zlkad.toml").string() + ": is not a PEM certificate"},
      {"absent", {"--bus", bus, "--config", (dir / "absent.toml").string()}, 78, "absent.toml: cannot read the configuration file: does not exist"},
      // Found at start, not by the first call failing with -5.
      {"ca_file_absent", {"--bus", bus, "--config", variant("ca.toml", "ca\\.pem", "absent.pem")}, 78, "ca.toml: tls.ca_file: "},
      {"usage", {"--bus", bus, "--log-level", "loud"}, 2, "--log-level"},
      {"check_passes", {"--bus", noBus, "--check-config", "--config", config}, 0, "the configuration is usable"},
      {"check_ca_file_absent", {"--bus", noBus, "--check-config", "--config", (dir / "ca.toml").string()}, 78, "absent.pem: does not exist"},
      {"check_unreadable", {"--bus", noBus, "--check-config", "--config", (dir / "secret.toml").string()}, 78,
       "secret.toml: cannot read the configuration file: permission denied"},
      {"check_manifest_ignored", {"--bus", noBus, "--check-config", "--config", variant("manifests.toml", "entitlements\\.d", "../bad-manifests")},
       78, "1 of 1 entitlement manifest(s) ignored"},
      {"check_entitlements_dir_absent", {"--bus", noBus, "--check-config", "--config", variant("nodir.toml", "entitlements\\.d", "absent.d")},
       78, "entitlements.dir: " + (dir / "state" / "absent.d").string() + ": does not exist"},
  };
  // clang-format on
  for (const Row& row : rows) {
    std::vector<std::string> argv = std::string(row.name) == "check_unreadable" ? asNobody : std::vector<std::string>{};
    argv.push_back(ZLKAD_PATH);
    argv.insert(argv.end(), row.arguments.begin(), row.arguments.end());
    auto run = zlkatest::runToEnd(argv, harness.directory());
    EXPECT_EQ(run.status, row.status) << row.name << ": " << run.err;
    EXPECT_THAT(run.err, HasSubstr(row.mention)) << row.name;
    // Fatal problems are errors in the log, so `journalctl -p err` shows them.
    if (row.status == 78) {
      EXPECT_THAT(run.err, HasSubstr("<error> ")) << row.name;
    }
  }
}

TEST(DaemonProcess, PropertiesShowWhatItDoesAndRootChangesTheLogLevelAtOnce) {
  Harness harness(/*anyUser=*/true);  // so that another user may try to change the level
  harness.entitleSelf();
  ASSERT_TRUE(harness.startDaemon());  // at --log-level info
  auto busctl = [&](std::vector<std::string> arguments, std::vector<std::string> launcher = {}) {
    launcher.insert(launcher.end(), {"/usr/bin/busctl", "--address=" + harness.busAddress()});
    launcher.insert(launcher.end(), arguments.begin(), arguments.end());
    return zlkatest::runToEnd(launcher, harness.directory());
  };
  const std::string name = "com.kestro.ZLKAuthentication.ZLKANetwork",
                    path = "/com/kestro/ZLKAuthentication/ZLKANetwork",
                    interface = "com.kestro.ZLKAuthentication.ZLKANetworkProtocol";
  const std::vector<std::string> logLevel = {name, "/org/freedesktop/LogControl1", "org.freedesktop.LogControl1",
                                             "LogLevel"};
  auto get = [&](const std::vector<std::string>& property) {
    std::vector<std::string> arguments = {"get-property"};
    arguments.insert(arguments.end(), property.begin(), property.end());
    return busctl(arguments).out;
  };

  // The file in dist/ is the interface served, properties included.
  const auto served = members(busctl({"introspect", "--xml-interface", name, path}).out, interface);
  EXPECT_EQ(served, members(zlkatest::readFile(std::string(DIST_DIR) + "/" + interface + ".xml"), interface));
  EXPECT_THAT(served, testing::Contains("property Answers a{st} read"));

  auto client = harness.connect();
  ASSERT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})), "ok");
  EXPECT_EQ(outcome(client->confirmActivation({platform::Data(std::vector<uint8_t>(64 * 1024 + 1))})).substr(0, 24),
            "ZLKAClientErrorDomain 4:");
  EXPECT_EQ(get({name, path, interface, "SessionState"}), "s \"open\"\n");
  EXPECT_THAT(get({name, path, interface, "SessionTimeToLive"}), testing::MatchesRegex("t [1-9][0-9]*\n"));
  EXPECT_EQ(get({name, path, interface, "CallsInFlight"}), "u 0\n");
  const std::string answers = get({name, path, interface, "Answers"});
  EXPECT_THAT(answers, HasSubstr("\"ok\" 1 ")) << answers;
  EXPECT_THAT(answers, HasSubstr("\"org.freedesktop.DBus.Error.InvalidArgs\" 1")) << answers;
  EXPECT_THAT(answers, HasSubstr("\"com.kestro.ZLKAuthentication.Error.Network\" 0")) << answers;

  EXPECT_EQ(get(logLevel), "s \"info\"\n");
  std::vector<std::string> set = {"set-property"};
  set.insert(set.end(), logLevel.begin(), logLevel.end());
  set.insert(set.end(), {"s", "debug"});
  // The test bus lets anyone send anything: what refuses another user here is the daemon's own check.
  if (const passwd* p = getpwnam("nobody"); geteuid() == 0 && p) {
    auto refused = busctl(set, {"/usr/bin/setpriv", "--reuid=" + std::to_string(p->pw_uid),
                                "--regid=" + std::to_string(p->pw_gid), "--clear-groups"});
    EXPECT_NE(refused.status, 0);
    EXPECT_THAT(refused.err, HasSubstr("Access denied"));
    EXPECT_EQ(get(logLevel), "s \"info\"\n");
  }
  EXPECT_THAT(harness.daemon()->standardError(), testing::Not(HasSubstr("<debug>")));
  auto changed = busctl(set);
  ASSERT_EQ(changed.status, 0) << changed.err;
  EXPECT_EQ(get(logLevel), "s \"debug\"\n");
  ASSERT_EQ(outcome(client->confirmActivation({sampleToken(), "U"})), "ok");
  EXPECT_THAT(harness.daemon()->standardError(), HasSubstr("<debug> [#TokenAuth]"));
}

TEST(DaemonProcess, ExitsOnIdleWhenAsked) {
  Harness harness;
  ASSERT_TRUE(harness.startDaemon({"--exit-on-idle", "1"}));
  EXPECT_EQ(harness.daemon()->waitExit(std::chrono::seconds(20)), 0);
  EXPECT_THAT(harness.daemon()->standardError(), HasSubstr("Shutting down (idle)"));
}

}  // namespace
}  // namespace service_test
