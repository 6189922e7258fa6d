// zlkactl: its command line, the token and JSON input it accepts, what it prints, its exit
// statuses, and the settings suite it edits. Operations run against the echo service.
#include <fstream>
#include <sstream>

#include "client_fixture.h"
#include "platform/json.h"
#include "zlkactl/command_line.h"
#include "zlkactl/commands.h"
#include "zlkactl/output_format.h"
#include "zlkactl/token_input.h"

namespace client_test {
namespace {

using platform::Array;
using platform::Data;
using platform::Dictionary;
using platform::Value;
using namespace zlkactl;

struct Outcome {
  ParsedCommandLine parsed;
  std::string out, err;
};

Outcome parse(std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), "zlkactl");
  std::vector<const char*> argv;
  for (const auto& a : arguments) argv.push_back(a.c_str());
  std::ostringstream out, err;
  ParsedCommandLine parsed = parseCommandLine(static_cast<int>(argv.size()), argv.data(), out, err);
  return {std::move(parsed), out.str(), err.str()};
}

struct CommandRun {
  int status;
  std::string out, err;
};

// Parses and runs, as main() does.
CommandRun runCommand(std::vector<std::string> arguments) {
  Outcome o = parse(std::move(arguments));
  if (!o.parsed.invocation) return {o.parsed.exitStatus, o.out, o.err};
  std::ostringstream out, err;
  int status = run(*o.parsed.invocation, out, err);
  return {status, out.str(), err.str()};
}

Data bytes(std::initializer_list<uint8_t> list) { return Data(std::vector<uint8_t>(list)); }

class TemporaryDirectory {
 public:
  TemporaryDirectory() {
    char pattern[] = "/tmp/zlkactl-test-XXXXXX";
    path_ = ::mkdtemp(pattern) ? pattern : "";
  }
  ~TemporaryDirectory() {
    std::error_code ec;
    if (!path_.empty()) std::filesystem::remove_all(path_, ec);
  }
  const std::filesystem::path& path() const { return path_; }
  std::filesystem::path write(const std::string& name, const std::string& contents) const {
    std::ofstream(path_ / name, std::ios::binary) << contents;
    return path_ / name;
  }

 private:
  std::filesystem::path path_;
};

TEST(ZlkactlCommandLineTest, OperationsTakeOnlyTheOptionsGiven) {
  Outcome full = parse({"--bus", "session", "metadata", "--token-hex", "0a0B", "--uuid", "U", "--locale", "en_US",
                        "--request-info", "{\"a\":1}", "--json"});
  ASSERT_TRUE(full.parsed.invocation) << full.err;
  const Invocation& inv = *full.parsed.invocation;
  EXPECT_EQ(inv.command, Command::Metadata);
  EXPECT_EQ(inv.bus, "session");
  EXPECT_TRUE(inv.json);  // top-level options are taken after the sub-command too
  EXPECT_EQ(inv.tokenHex, "0a0B");
  EXPECT_EQ(inv.tokenFile, std::nullopt);
  EXPECT_EQ(inv.tokenBase64, std::nullopt);
  EXPECT_EQ(inv.uuid, "U");
  EXPECT_EQ(inv.locale, "en_US");
  EXPECT_EQ(inv.requestInfo, "{\"a\":1}");

  Outcome bare = parse({"activate"});
  ASSERT_TRUE(bare.parsed.invocation);
  EXPECT_EQ(bare.parsed.invocation->command, Command::Activate);
  EXPECT_EQ(bare.parsed.invocation->bus, "system");
  EXPECT_FALSE(bare.parsed.invocation->json);
  EXPECT_FALSE(bare.parsed.invocation->tokenHex || bare.parsed.invocation->tokenFile || bare.parsed.invocation->tokenBase64 ||
               bare.parsed.invocation->uuid);
  auto arguments = tokenArguments(*bare.parsed.invocation, nullptr);
  ASSERT_TRUE(arguments);
  EXPECT_FALSE(arguments->token || arguments->uuid);

  Outcome confirm = parse({"confirm", "--token-base64", "AQI=", "--bus", "unix:path=/run/x"});
  ASSERT_TRUE(confirm.parsed.invocation);
  EXPECT_EQ(confirm.parsed.invocation->command, Command::Confirm);
  EXPECT_EQ(confirm.parsed.invocation->bus, "unix:path=/run/x");
  auto confirmArguments = tokenArguments(*confirm.parsed.invocation, nullptr);
  ASSERT_TRUE(confirmArguments);
  EXPECT_EQ(confirmArguments->token, bytes({1, 2}));
}

TEST(ZlkactlCommandLineTest, DefaultsSubcommands) {
  Outcome all = parse({"--config", "/tmp/z.toml", "defaults", "read"});
  ASSERT_TRUE(all.parsed.invocation);
  EXPECT_EQ(all.parsed.invocation->command, Command::DefaultsRead);
  EXPECT_EQ(all.parsed.invocation->configPath, "/tmp/z.toml");
  EXPECT_EQ(all.parsed.invocation->key, std::nullopt);

  Outcome one = parse({"defaults", "read", "Server"});
  ASSERT_TRUE(one.parsed.invocation);
  EXPECT_EQ(one.parsed.invocation->key, "Server");
  EXPECT_EQ(one.parsed.invocation->configPath, kDefaultConfigPath);

  Outcome write = parse({"defaults", "write", "Server", "it"});
  ASSERT_TRUE(write.parsed.invocation);
  EXPECT_EQ(write.parsed.invocation->command, Command::DefaultsWrite);
  EXPECT_EQ(write.parsed.invocation->key, "Server");
  EXPECT_EQ(write.parsed.invocation->value, "it");

  Outcome remove = parse({"defaults", "delete", "Server"});
  ASSERT_TRUE(remove.parsed.invocation);
  EXPECT_EQ(remove.parsed.invocation->command, Command::DefaultsDelete);
  EXPECT_EQ(remove.parsed.invocation->key, "Server");
}

TEST(ZlkactlCommandLineTest, UsageErrorsExitWithTwo) {
  const std::vector<std::vector<std::string>> wrong = {
      {},
      {"frobnicate"},
      {"metadata", "--token-hex", "00", "--token-base64", "AA=="},
      {"activate", "--token-file", "/x", "--token-hex", "00"},
      {"activate", "--locale", "en_US"},
      {"confirm", "--request-info", "{}"},
      {"--bus", "nowhere", "confirm"},
      {"metadata", "--uuid"},
      {"defaults"},
      {"defaults", "write", "KeyOnly"},
      {"defaults", "delete"},
      {"defaults", "read", "a", "b"},
  };
  for (const auto& arguments : wrong) {
    Outcome o = parse(arguments);
    std::string shown = testing::PrintToString(arguments);
    EXPECT_FALSE(o.parsed.invocation) << shown;
    EXPECT_EQ(o.parsed.exitStatus, kExitUsage) << shown;
    EXPECT_EQ(o.err.rfind("zlkactl: ", 0), 0u) << shown << ": " << o.err;
    EXPECT_TRUE(o.out.empty()) << shown;
  }
}

TEST(ZlkactlCommandLineTest, HelpExplainsEveryCommandWithAnExample) {
  const std::vector<std::vector<std::string>> helps = {
      {"--help"}, {"metadata", "--help"}, {"activate", "--help"}, {"confirm", "--help"},
      {"defaults", "--help"}, {"defaults", "read", "--help"}, {"defaults", "write", "--help"}, {"defaults", "delete", "--help"},
  };
  for (const auto& arguments : helps) {
    Outcome o = parse(arguments);
    std::string shown = testing::PrintToString(arguments);
    EXPECT_FALSE(o.parsed.invocation) << shown;
    EXPECT_EQ(o.parsed.exitStatus, kExitSuccess) << shown;
    EXPECT_NE(o.out.find("Example"), std::string::npos) << shown << o.out;
    EXPECT_TRUE(o.err.empty()) << shown;
  }
  Outcome top = parse({"--help"});
  for (const char* mention : {"--bus", "--json", "--config", "metadata", "activate", "confirm", "defaults", "Exit status"})
    EXPECT_NE(top.out.find(mention), std::string::npos) << mention;
  Outcome metadata = parse({"metadata", "--help"});
  for (const char* mention : {"--token-file", "--token-hex", "--token-base64", "--uuid", "--locale", "--request-info"})
    EXPECT_NE(metadata.out.find(mention), std::string::npos) << mention;
}

TEST(ZlkactlInputTest, HexAndBase64Tokens) {
  std::string error;
  EXPECT_EQ(parseHexToken("00ffA0b1", &error), bytes({0x00, 0xff, 0xa0, 0xb1}));
  EXPECT_EQ(parseHexToken("", &error), Data());
  EXPECT_EQ(parseHexToken("abc", &error), std::nullopt);
  EXPECT_EQ(error, "--token-hex: an odd number of hex digits");
  EXPECT_EQ(parseHexToken("0g", &error), std::nullopt);
  EXPECT_EQ(error, "--token-hex: character 2 is not a hex digit");
  EXPECT_EQ(parseHexToken("0a 0b", &error), std::nullopt);
  EXPECT_EQ(parseHexToken("0x0a", &error), std::nullopt);

  EXPECT_EQ(parseBase64Token("AQID", &error), bytes({1, 2, 3}));
  EXPECT_EQ(parseBase64Token("AQI=", &error), bytes({1, 2}));
  for (const char* bad : {"AQI", "AQ I=", "AQI=\n", "A*I=", "AQ==AQ=="}) {
    error.clear();
    EXPECT_EQ(parseBase64Token(bad, &error), std::nullopt) << bad;
    EXPECT_NE(error.find("--token-base64"), std::string::npos);
  }
  EXPECT_EQ(hexString(bytes({0x00, 0x0f, 0xab})), "000fab");
}

TEST(ZlkactlInputTest, TokenFiles) {
  TemporaryDirectory dir;
  ASSERT_FALSE(dir.path().empty());
  std::string error;
  auto binary = dir.write("token.bin", std::string("\x00\x01\xff\n", 4));
  EXPECT_EQ(readTokenFile(binary, &error), bytes({0x00, 0x01, 0xff, 0x0a}));
  EXPECT_EQ(readTokenFile(dir.write("empty", ""), &error), Data());

  EXPECT_EQ(readTokenFile(dir.path() / "missing", &error), std::nullopt);
  EXPECT_EQ(error, "--token-file: cannot read " + (dir.path() / "missing").string() + ": No such file or directory");
  EXPECT_EQ(readTokenFile(dir.path(), &error), std::nullopt);
  EXPECT_EQ(error, "--token-file: cannot read " + dir.path().string() + ": Is a directory");
  auto large = dir.write("large", std::string(kMaxTokenFileSize + 1, 'x'));
  EXPECT_EQ(readTokenFile(large, &error), std::nullopt);
  EXPECT_NE(error.find("is larger than"), std::string::npos);
  EXPECT_TRUE(readTokenFile(dir.write("limit", std::string(kMaxTokenFileSize, 'x')), &error));
}

TEST(ZlkactlInputTest, RequestInfoMustBeASendableObject) {
  std::string error;
  auto info = parseRequestInfo("{\"n\":1,\"list\":[true,\"x\"],\"d\":{\"r\":1.5}}", &error);
  ASSERT_TRUE(info) << error;
  EXPECT_EQ(Value(*info), Value(Dictionary{{"n", 1}, {"list", Array{Value(true), Value("x")}}, {"d", Dictionary{{"r", 1.5}}}}));
  EXPECT_EQ(parseRequestInfo("[1]", &error), std::nullopt);
  EXPECT_EQ(error, "--request-info: must be a JSON object, not an array");
  EXPECT_EQ(parseRequestInfo("{\"a\":", &error), std::nullopt);
  EXPECT_EQ(error.rfind("--request-info: not valid JSON", 0), 0u) << error;
  EXPECT_EQ(parseRequestInfo("{\"a\":[1,null]}", &error), std::nullopt);
  EXPECT_EQ(error, "--request-info: requestInfo.a[1] is null, and a null cannot be sent");
}

TEST(ZlkactlInputTest, SettingsValuesAreJSONWhenTheyCanBe) {
  EXPECT_EQ(parseSettingsValue("true"), Value(true));
  EXPECT_EQ(parseSettingsValue("3"), Value(3));
  EXPECT_EQ(parseSettingsValue(" -2.5 "), Value(-2.5));
  EXPECT_EQ(parseSettingsValue("\"x\""), Value("x"));
  EXPECT_EQ(parseSettingsValue("null"), Value());
  EXPECT_EQ(parseSettingsValue("{\"a\":[1]}"), Value(Dictionary{{"a", Array{Value(1)}}}));
  EXPECT_TRUE(parseSettingsValue("true").isBool());
  for (const char* plain : {"it", "YES", "", "1,2", "[1", "1]", "https://127.0.0.1:8443", "x\"", "],["})
    EXPECT_EQ(parseSettingsValue(plain), Value(plain)) << plain;
}

TEST(ZlkactlOutputTest, Formats) {
  zlka_client::MetadataReply reply{"P-1", "en_US", Value(Dictionary{{"plan", "basic"}, {"seats", 2}})};
  EXPECT_EQ(formatMetadata(reply, false), "ppid: P-1\nlocale: en_US\nmetadata:\n{\n  \"plan\": \"basic\",\n  \"seats\": 2\n}\n");
  EXPECT_EQ(formatMetadata(reply, true), "{\"locale\":\"en_US\",\"metadata\":{\"plan\":\"basic\",\"seats\":2},\"ppid\":\"P-1\"}\n");
  EXPECT_EQ(formatActivation(bytes({0xde, 0xad, 0x01}), false), "token: dead01\nlength: 3 bytes\n");
  EXPECT_EQ(formatActivation(bytes({0xde, 0xad, 0x01}), true), "{\"length\":3,\"token_base64\":\"3q0B\",\"token_hex\":\"dead01\"}\n");
  EXPECT_EQ(formatConfirmation(false), "confirmed\n");
  EXPECT_EQ(formatConfirmation(true), "{\"confirmed\":true}\n");
  platform::Error error("ZLKATokenManagerErrorDomain", -3,
                        Dictionary{{platform::LocalizedDescriptionKey, "An invalid parameter was provided by the caller."}});
  EXPECT_EQ(formatError(error), "zlkactl: ZLKATokenManagerErrorDomain -3: An invalid parameter was provided by the caller.\n");
  EXPECT_EQ(jsonText(Value("a\"b"), true), "\"a\\\"b\"");
  EXPECT_EQ(jsonText(Value(false), true), "false");
  EXPECT_EQ(jsonText(Value(Dictionary{}), true), "{}");
}

TEST_F(ClientBusTest, ZlkactlOperationsPrintTheAnswerAndSendOnlyWhatWasGiven) {
  CommandRun metadata = runCommand({"--bus", bus->address(), "--json", "metadata", "--token-hex", "0a0b", "--locale", "en_US",
                             "--request-info", "{\"source\":\"setup\",\"n\":7}"});
  EXPECT_EQ(metadata.status, kExitSuccess) << metadata.err;
  EXPECT_EQ(metadata.out, "{\"locale\":\"en_US\",\"metadata\":{\"plan\":\"basic\",\"seats\":2},\"ppid\":\"ppid-1\"}\n");
  EXPECT_EQ(metadata.err, "");
  EXPECT_EQ(service->lastCall()->arguments,
            "a{sv}[s:\"token\"=<ay:0a0b>,s:\"requestedLocale\"=<s:\"en_US\">,s:\"requestInfo\"=<a{sv}[s:\"n\"=<x:7>,s:\"source\"=<s:\"setup\">]>]");

  CommandRun activation = runCommand({"--bus", bus->address(), "activate", "--token-base64", "AQI=", "--uuid", "U-9"});
  EXPECT_EQ(activation.status, kExitSuccess) << activation.err;
  EXPECT_EQ(activation.out, "token: deadbeef\nlength: 4 bytes\n");
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[s:\"token\"=<ay:0102>,s:\"uuid\"=<s:\"U-9\">]");

  CommandRun confirmation = runCommand({"--bus", bus->address(), "confirm"});
  EXPECT_EQ(confirmation.status, kExitSuccess) << confirmation.err;
  EXPECT_EQ(confirmation.out, "confirmed\n");
  EXPECT_EQ(service->lastCall()->arguments, "a{sv}[]");
}

TEST_F(ClientBusTest, ZlkactlFailuresHaveTheirOwnExitStatus) {
  service->answerWith(EchoService::error("com.kestro.ZLKAuthentication.Error.Network", "There was a problem connecting to the network."));
  CommandRun failed = runCommand({"--bus", bus->address(), "--json", "confirm", "--token-hex", "00"});
  EXPECT_EQ(failed.status, kExitOperationFailed);
  EXPECT_EQ(failed.out, "");
  EXPECT_EQ(failed.err, "zlkactl: ZLKATokenManagerErrorDomain -5: There was a problem connecting to the network.\n");

  service->answerWith(EchoService::error("org.freedesktop.DBus.Error.InvalidArgs", "Unknown key 'x'."));
  CommandRun refused = runCommand({"--bus", bus->address(), "activate"});
  EXPECT_EQ(refused.status, kExitOperationFailed);
  EXPECT_EQ(refused.err, "zlkactl: ZLKAClientErrorDomain 4: The call was refused with org.freedesktop.DBus.Error.InvalidArgs: Unknown key 'x'.\n");

  size_t before = service->calls().size();
  for (const std::vector<std::string>& bad : std::vector<std::vector<std::string>>{
           {"--bus", bus->address(), "metadata", "--token-hex", "0"},
           {"--bus", bus->address(), "metadata", "--request-info", "{\"a\":null}"},
           {"--bus", bus->address(), "activate", "--token-file", "/nonexistent/token"},
           {"--bus", bus->address(), "confirm", "--token-base64", "@@@@"},
       }) {
    CommandRun usage = runCommand(bad);
    EXPECT_EQ(usage.status, kExitUsage) << testing::PrintToString(bad);
    EXPECT_EQ(usage.err.rfind("zlkactl: --", 0), 0u) << usage.err;
  }
  EXPECT_EQ(service->calls().size(), before);

  PrivateBus empty;
  ASSERT_TRUE(empty.running());
  CommandRun absent = runCommand({"--bus", empty.address(), "confirm"});
  EXPECT_EQ(absent.status, kExitUnreachable);
  EXPECT_EQ(absent.err.rfind("zlkactl: ZLKAClientErrorDomain 2: The service com.kestro.ZLKAuthentication.ZLKANetwork cannot be reached", 0), 0u)
      << absent.err;
  CommandRun noBus = runCommand({"--bus", "unix:path=/nonexistent/socket", "confirm"});
  EXPECT_EQ(noBus.status, kExitUnreachable);
  EXPECT_EQ(noBus.err, "zlkactl: ZLKAClientErrorDomain 1: Cannot connect to the bus at \"unix:path=/nonexistent/socket\": No such file or directory.\n");
}

class ZlkactlDefaultsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(dir.path().empty());
    config = dir.write("zlkad.toml",
                       "[device]\ninternal_build = true\ndevice_class = \"AccessoryHub\"\n"
                       "[servers.prod]\nstatic_content = \"https://127.0.0.1:1\"\napi = \"https://127.0.0.1:1\"\n"
                       "[sap]\ntrust_anchor = \"" + (dir.path() / "root.pem").string() + "\"\n"
                       "[settings]\nsuite_dir = \"" + (dir.path() / "defaults").string() + "\"\n");
    suite = dir.path() / "defaults" / "com.kestro.ZLKAuthentication.json";
  }
  CommandRun defaults(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {"--config", config.string(), "defaults"});
    return runCommand(arguments);
  }
  Value onDisk() {
    std::ifstream in(suite);
    std::stringstream text;
    text << in.rdbuf();
    return platform::json::parse(text.str()).value_or(Value("unparsable"));
  }

  TemporaryDirectory dir;
  std::filesystem::path config, suite;
};

TEST_F(ZlkactlDefaultsTest, WriteReadDelete) {
  CommandRun empty = defaults({"read"});
  EXPECT_EQ(empty.status, kExitSuccess) << empty.err;
  EXPECT_EQ(empty.out, "{}\n");

  for (const auto& [key, value] : std::vector<std::pair<std::string, std::string>>{
           {"ForceNetworkFailure", "true"}, {"Count", "3"}, {"Server", "it"}, {"Quoted", "\"it\""}, {"Plan", "{\"a\":[1,2]}"}}) {
    CommandRun write = defaults({"write", key, value});
    EXPECT_EQ(write.status, kExitSuccess) << write.err;
    EXPECT_EQ(write.out, "");
  }
  EXPECT_EQ(onDisk(), Value(Dictionary{{"ForceNetworkFailure", true},
                                       {"Count", 3},
                                       {"Server", "it"},
                                       {"Quoted", "it"},
                                       {"Plan", Dictionary{{"a", Array{Value(1), Value(2)}}}}}));
  EXPECT_EQ(defaults({"read", "ForceNetworkFailure"}).out, "true\n");
  EXPECT_EQ(defaults({"read", "Server"}).out, "\"it\"\n");
  EXPECT_EQ(defaults({"read", "Plan"}).out, "{\n  \"a\": [\n    1,\n    2\n  ]\n}\n");
  CommandRun all = defaults({"read"});
  EXPECT_EQ(platform::json::parse(all.out).value_or(Value()), onDisk());

  EXPECT_EQ(defaults({"delete", "Server"}).status, kExitSuccess);
  CommandRun gone = defaults({"read", "Server"});
  EXPECT_EQ(gone.status, kExitOperationFailed);
  EXPECT_EQ(gone.out, "");
  EXPECT_EQ(gone.err, "zlkactl: com.kestro.ZLKAuthentication has no value for 'Server' (" + suite.string() + ")\n");
  EXPECT_EQ(onDisk().find("Server"), nullptr);
  EXPECT_EQ(defaults({"delete", "Server"}).status, kExitSuccess);  // already absent
}

TEST_F(ZlkactlDefaultsTest, AnUnusableConfigurationIsAUsageError) {
  CommandRun missing = runCommand({"--config", (dir.path() / "none.toml").string(), "defaults", "read"});
  EXPECT_EQ(missing.status, kExitUsage);
  EXPECT_NE(missing.err.find((dir.path() / "none.toml").string()), std::string::npos) << missing.err;

  auto broken = dir.write("broken.toml", "[device]\ninternal_build = \"no\"\n");
  CommandRun invalid = runCommand({"--config", broken.string(), "defaults", "write", "A", "1"});
  EXPECT_EQ(invalid.status, kExitUsage);
  EXPECT_NE(invalid.err.find("device.internal_build"), std::string::npos) << invalid.err;
  EXPECT_FALSE(std::filesystem::exists(suite));
}

TEST_F(ZlkactlDefaultsTest, AnUnwritableSuiteIsAnOperationFailure) {
  // A suite directory that is a regular file cannot hold the suite, whatever the privileges.
  dir.write("not-a-directory", "");
  auto blocked = dir.write("blocked.toml",
                           "[device]\ninternal_build = true\ndevice_class = \"AccessoryHub\"\n"
                           "[servers.prod]\nstatic_content = \"https://127.0.0.1:1\"\napi = \"https://127.0.0.1:1\"\n"
                           "[sap]\ntrust_anchor = \"/x.pem\"\n"
                           "[settings]\nsuite_dir = \"" + (dir.path() / "not-a-directory").string() + "\"\n");
  std::string path = (dir.path() / "not-a-directory" / "com.kestro.ZLKAuthentication.json").string();
  for (const auto& command : std::vector<std::vector<std::string>>{{"write", "A", "1"}, {"delete", "A"}}) {
    std::vector<std::string> arguments = {"--config", blocked.string(), "defaults"};
    arguments.insert(arguments.end(), command.begin(), command.end());
    CommandRun run = runCommand(arguments);
    EXPECT_EQ(run.status, kExitOperationFailed);
    EXPECT_EQ(run.err, "zlkactl: cannot write " + path + "\n");
  }
}

}  // namespace
}  // namespace client_test
