// What zlkactl adds to the client library: turning options into exactly the arguments given,
// printing answers and errors, one exit status per class of failure, and the settings suite.
#include <gmock/gmock.h>

#include <fstream>
#include <sstream>

#include "common/child_process.h"
#include "echo_service.h"
#include "zlkactl/command_line.h"
#include "zlkactl/commands.h"
#include "zlkactl/token_input.h"

namespace client_test {
namespace {

struct Outcome {
  int status;
  std::string out, err;
};

// Parses and runs, as main() does.
Outcome zlkactl(std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), "zlkactl");
  std::vector<const char*> argv;
  for (const auto& a : arguments) argv.push_back(a.c_str());
  std::ostringstream out, err;
  auto parsed = zlkactl::parseCommandLine(static_cast<int>(argv.size()), argv.data(), out, err);
  int status = parsed.invocation ? zlkactl::run(*parsed.invocation, out, err) : parsed.exitStatus;
  return {status, out.str(), err.str()};
}

TEST_F(ClientTest, ZlkactlSendsWhatItIsGivenAndExitsByTheKindOfFailure) {
  zlkatest::TempDir dir;
  const std::string token = (dir.path() / "token").string(), large = (dir.path() / "large").string(), b = bus->address();
  std::ofstream(token) << std::string("\x00\x01\xff", 3);
  std::ofstream(large) << std::string(zlkactl::kMaxTokenFileSize + 1, 'x');
  // Usage errors (2) and unreachable services (3) send nothing; the rest sends `sent`.
  // clang-format off
  const struct { std::vector<std::string> arguments; EchoService::Answer answer; int status; std::string out, err, sent; } rows[] = {
      {{"--bus", b, "--json", "metadata", "--token-hex", "0a0B", "--locale", "en_US", "--request-info", R"({"s":"setup","n":7})"}, nullptr, 0,
       R"({"locale":"en_US","metadata":{"plan":"basic","seats":2},"ppid":"ppid-1"})" "\n", "",
       R"(RequestMetadataForToken a{sv}[s:"token"=<ay:0a0b>,s:"requestedLocale"=<s:"en_US">,s:"requestInfo"=<a{sv}[s:"n"=<x:7>,s:"s"=<s:"setup">]>])"},
      {{"metadata", "--uuid", "U", "--bus", b}, nullptr, 0, "ppid: ppid-1\nlocale: en_US\nmetadata:\n{\n  \"plan\": \"basic\",\n  \"seats\": 2\n}\n", "",
       R"(RequestMetadataForToken a{sv}[s:"uuid"=<s:"U">])"},
      {{"--bus", b, "activate", "--token-base64", "AQI=", "--uuid", "U-9"}, nullptr, 0, "token: deadbeef\nlength: 4 bytes\n", "",
       R"(RequestActivationForToken a{sv}[s:"token"=<ay:0102>,s:"uuid"=<s:"U-9">])"},
      {{"--bus", b, "--json", "activate", "--token-file", token}, nullptr, 0, R"({"length":4,"token_base64":"3q2+7w==","token_hex":"deadbeef"})" "\n", "",
       R"(RequestActivationForToken a{sv}[s:"token"=<ay:0001ff>])"},
      {{"--bus", b, "confirm"}, nullptr, 0, "confirmed\n", "", "ConfirmActivationForToken a{sv}[]"},
      {{"--bus", b, "--json", "confirm"}, nullptr, 0, "{\"confirmed\":true}\n", "", "ConfirmActivationForToken a{sv}[]"},
      {{"--bus", b, "confirm"}, EchoService::error("com.kestro.ZLKAuthentication.Error.Network", "Gone."), 1, "",
       "zlkactl: ZLKATokenManagerErrorDomain -5: Gone.\n", "ConfirmActivationForToken a{sv}[]"},
      {{"--bus", "unix:path=/nonexistent/zlka", "confirm"}, nullptr, 3, "",
       "zlkactl: ZLKAClientErrorDomain 1: Cannot connect to the bus at \"unix:path=/nonexistent/zlka\": No such file or directory.\n", ""},
      {{"--bus", b, "metadata", "--token-hex", "abc"}, nullptr, 2, "", "zlkactl: --token-hex: an odd number of hex digits\n", ""},
      {{"--bus", b, "metadata", "--token-hex", "0g"}, nullptr, 2, "", "zlkactl: --token-hex: character 2 is not a hex digit\n", ""},
      {{"--bus", b, "confirm", "--token-base64", "AQI"}, nullptr, 2, "", "zlkactl: --token-base64: not valid base64", ""},
      {{"--bus", b, "activate", "--token-file", "/nonexistent/t"}, nullptr, 2, "", "zlkactl: --token-file: cannot read /nonexistent/t: No such file", ""},
      {{"--bus", b, "activate", "--token-file", large}, nullptr, 2, "", "zlkactl: --token-file: " + large + " is larger than 1048576 bytes\n", ""},
      {{"--bus", b, "activate", "--uuid", "\xff"}, nullptr, 2, "", "zlkactl: --uuid: not UTF-8 text\n", ""},
      {{"--bus", b, "metadata", "--request-info", "[1]"}, nullptr, 2, "", "zlkactl: --request-info: must be a JSON object, not an array\n", ""},
      {{"--bus", b, "metadata", "--request-info", "{\"a\":"}, nullptr, 2, "", "zlkactl: --request-info: not valid JSON", ""},
      {{"--bus", b, "metadata", "--request-info", R"({"a":[null]})"}, nullptr, 2, "", "zlkactl: --request-info: requestInfo.a[0] is null", ""},
      {{"--bus", b, "metadata", "--token-hex", "00", "--token-base64", "AA=="}, nullptr, 2, "", "zlkactl: ", ""},  // one token source
      {{"--bus", b, "activate", "--locale", "en_US"}, nullptr, 2, "", "zlkactl: ", ""},  // metadata only
      {{"--bus", "nowhere", "confirm"}, nullptr, 2, "", "zlkactl: ", ""},
      {{"--bus", b}, nullptr, 2, "", "zlkactl: ", ""},
  };
  // clang-format on
  for (const auto& row : rows) {
    service->answerWith(row.answer ? row.answer : EchoService::canned);
    size_t before = service->calls().size();
    Outcome run = zlkactl(row.arguments);
    std::string shown = testing::PrintToString(row.arguments);
    EXPECT_EQ(run.status, row.status) << shown << run.err;
    EXPECT_EQ(run.out, row.out) << shown;
    EXPECT_THAT(run.err, testing::StartsWith(row.err)) << shown;
    EXPECT_EQ(service->calls().size(), before + !row.sent.empty()) << shown;
    if (!row.sent.empty()) {
      EXPECT_EQ(lastCall(), row.sent) << shown;
    }
  }
  for (const char* command : {"metadata", "activate", "confirm", "defaults"}) {
    Outcome help = zlkactl({command, "--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_THAT(help.out, testing::HasSubstr("Example")) << command;
  }
}

TEST(Zlkactl, DefaultsKeepJSONValuesAndPlainStrings) {
  zlkatest::TempDir temporary;
  const std::filesystem::path dir = temporary.path(), config = dir / "zlkad.toml";
  std::ofstream(config) << "[device]\ninternal_build = true\ndevice_class = \"AccessoryHub\"\n"
                           "[servers.prod]\nstatic_content = \"https://127.0.0.1:1\"\napi = \"https://127.0.0.1:1\"\n"
                           "[sap]\ntrust_anchor = \"/x.pem\"\n[settings]\nsuite_dir = \"" << dir.string() << "\"\n";
  const std::string suite = (dir / "com.kestro.ZLKAuthentication.json").string();
  const struct { std::vector<std::string> arguments; int status; std::string out, err; } rows[] = {
      {{"write", "Plan", R"({"a":[1]})"}, 0, "", ""},
      {{"write", "Pair", "1,2"}, 0, "", ""},  // not one JSON value
      {{"read", "Plan"}, 0, "{\n  \"a\": [\n    1\n  ]\n}\n", ""},
      {{"delete", "Plan"}, 0, "", ""},
      {{"read"}, 0, "{\n  \"Pair\": \"1,2\"\n}\n", ""},
      {{"read", "Plan"}, 1, "", "zlkactl: com.kestro.ZLKAuthentication has no value for 'Plan' (" + suite + ")\n"},
  };
  for (const auto& row : rows) {
    std::vector<std::string> arguments = {"--config", config.string(), "defaults"};
    arguments.insert(arguments.end(), row.arguments.begin(), row.arguments.end());
    Outcome run = zlkactl(arguments);
    EXPECT_EQ(run.status, row.status) << row.arguments[0] << run.err;
    EXPECT_EQ(run.out, row.out) << row.arguments[0];
    EXPECT_EQ(run.err, row.err) << row.arguments[0];
  }
  Outcome unusable = zlkactl({"--config", (dir / "absent.toml").string(), "defaults", "read"});
  EXPECT_EQ(unusable.status, 2);
  EXPECT_THAT(unusable.err, testing::HasSubstr("absent.toml"));
}

}  // namespace
}  // namespace client_test
