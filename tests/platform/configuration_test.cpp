#include "platform/config/configuration.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/config/device_facts.h"

namespace {

namespace fs = std::filesystem;

const std::string kMinimal =
    "[device]\ninternal_build = true\ndevice_class = \"AccessoryHub\"\n[servers.prod]\n"
    "static_content = \"https://static.example.net/\"\napi = \"https://api.example.net:8443\"\n"
    "[sap]\ntrust_anchor = \"/etc/zlka/sap-root.pem\"\n";
const fs::path kFile = fs::temp_directory_path() / ("zlkad-" + std::to_string(getpid()) + ".toml");

std::string replaced(std::string text, const std::string& from, const std::string& to) {
  return text.replace(text.find(from), from.size(), to);
}
platform::Result<platform::Configuration> load(const std::string& text) {
  std::ofstream(kFile) << text;
  auto c = platform::loadConfiguration(kFile);
  fs::remove(kFile);
  return c;
}

TEST(Configuration, MinimalFileGetsTheDefaultsAndAFullOneWarnsOfUnknownKeys) {
  auto c = load(kMinimal);
  ASSERT_TRUE(c) << c.error();
  EXPECT_EQ(std::tie(c->device.internalBuild, c->device.deviceClass), std::tuple(true, "AccessoryHub"));
  EXPECT_EQ(std::tuple(c->servers.size(), c->servers.at("prod").staticContent, c->servers.at("prod").api),
            std::tuple(1u, "https://static.example.net", "https://api.example.net:8443"));  // trailing slash dropped
  EXPECT_EQ(std::tie(c->trustAnchor, c->caFile, c->settingsDirectory, c->entitlementsDirectory),
            std::tuple("/etc/zlka/sap-root.pem", "", "/var/lib/zlka/defaults", "/etc/zlka/entitlements.d"));
  EXPECT_EQ(std::tuple(c->logLevel, c->privateData, c->maxWorkers, c->warnings.size()),
            std::tuple(platform::LogLevel::Default, false, 64u, 0u));

  c = load(kMinimal +
           "[servers.ut]\nstatic_content = \"https://s\"\napi = \"https://a\"\n[tls]\nca_file = \"/ca.pem\"\n"
           "[settings]\nsuite_dir = \"/d\"\n[entitlements]\ndir = \"/e\"\n[log]\nlevel = \"debug\"\n"
           "private_data = true\ncolour = \"blue\"\n[service]\nmax_workers = 2\n[extra]\nx = 1\n");
  ASSERT_TRUE(c) << c.error();
  EXPECT_EQ(c->servers.at("ut").api, "https://a");
  EXPECT_EQ(std::tie(c->caFile, c->settingsDirectory, c->entitlementsDirectory), std::tuple("/ca.pem", "/d", "/e"));
  EXPECT_EQ(std::tie(c->logLevel, c->privateData, c->maxWorkers), std::tuple(platform::LogLevel::Debug, true, 2u));
  EXPECT_EQ(c->warnings, (std::vector<std::string>{kFile.string() + ": unknown key 'extra' ignored",
                                                   kFile.string() + ": unknown key 'log.colour' ignored"}));
  EXPECT_EQ(load(kMinimal + "[service]\nmax_workers = 4096\n")->maxWorkers, 4096u);
}

TEST(Configuration, EveryProblemNamesTheFileAndTheKey) {
  const std::string api = "https://api.example.net:8443";
  // clang-format off
  const std::pair<std::string, std::string> rows[] = {  // the file's text, the error after "<file>: "
      {replaced(kMinimal, "internal_build = true\n", ""), "device.internal_build: missing (expected true or false)"},
      {replaced(kMinimal, "internal_build = true", "internal_build = \"yes\""), "device.internal_build: expected true or false"},
      {replaced(kMinimal, "device_class = \"AccessoryHub\"", "device_class = 3"), "device.device_class: expected a string"},
      {replaced(kMinimal, api, "http://api.example.net"), "servers.prod.api: 'http://api.example.net' is not an absolute https base URL"},
      {replaced(kMinimal, "[servers.prod]", "[servers.other]"), "servers.prod: missing table"},
      {kMinimal + "[servers.it]\napi = \"https://it.example.net\"\n", "servers.it.static_content: missing"},  // all or nothing
      {kMinimal + "[servers]\nmaint = 1\n", "servers.maint: missing table"},
      {replaced(kMinimal, "\"/etc/zlka/sap-root.pem\"", "\"\""), "sap.trust_anchor: must name a PEM file"},
      {replaced(kMinimal, "trust_anchor", "anchor"), "sap.trust_anchor: missing"},
      {kMinimal + "[tls]\nca_file = true\n", "tls.ca_file: expected a string"},
      {kMinimal + "[settings]\nsuite_dir = \"\"\n", "settings.suite_dir: must not be empty"},
      {kMinimal + "[entitlements]\ndir = \"\"\n", "entitlements.dir: must not be empty"},
      {kMinimal + "[log]\nlevel = \"verbose\"\n", "log.level: 'verbose' is not one of debug, info, default, error, fault"},
      {kMinimal + "[log]\nprivate_data = 1\n", "log.private_data: expected true or false"},
      {kMinimal + "[service]\nmax_workers = 1\n", "service.max_workers: expected a whole number from 2 to 4096"},
      {kMinimal + "[service]\nmax_workers = 4097\n", "service.max_workers: expected a whole number from 2 to 4096"},
      {kMinimal + "[service]\nmax_workers = \"8\"\n", "service.max_workers: expected a whole number from 2 to 4096"},
      {"[device\n", ":1: "},  // a parse error names the line instead
  };
  // clang-format on
  for (const auto& [text, message] : rows) {
    auto c = load(text);
    ASSERT_FALSE(c) << message;
    std::string expected = kFile.string() + (message[0] == ':' ? message : ": " + message);
    EXPECT_EQ(c.error().substr(0, expected.size()), expected);
  }
  EXPECT_EQ(platform::loadConfiguration(kFile.parent_path()).error(),
            kFile.parent_path().string() + ": cannot read the configuration file: is not a regular file");
}

TEST(Configuration, BaseURLsAreAbsoluteHttpsWithoutPathQueryOrUser) {
  EXPECT_EQ(platform::normalizedBaseURL("https://h"), "https://h");
  EXPECT_EQ(platform::normalizedBaseURL("https://127.0.0.1:4443/"), "https://127.0.0.1:4443");
  EXPECT_EQ(platform::normalizedBaseURL("https://[::1]:4443"), "https://[::1]:4443");
  for (const char* bad :
       {"", "h", "http://h", "https://", "https://h/p", "https://h?q=1", "https://h#f", "https://u:p@h", "ftp://h"})
    EXPECT_FALSE(platform::normalizedBaseURL(bad)) << bad;
}

TEST(DeviceFacts, AreReadOnceFromTheDeviceTableAndAMissingOrBrokenFileAnswersProduction) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");  // the shared pool's workers may be alive already
  // Device facts are read once per process, so each row runs in a child, which exits 0 when the
  // facts are as expected. No text: no file.
  // clang-format off
  const std::tuple<const char*, bool, std::optional<std::string>, const char*> rows[] = {
      {"[device]\ninternal_build = true\ndevice_class = \"AccessoryHub\"\n", true, "AccessoryHub", ""},
      {"[device]\ndevice_class = \"Hub\"\n", false, "Hub", ""}, {nullptr, false, std::nullopt, ""},
      {"[device\ninternal_build = true\n", false, std::nullopt, "Could not read device facts"}};
  // clang-format on
  for (const auto& [text, internal, deviceClass, logged] : rows)
    EXPECT_EXIT(
        {
          if (text) std::ofstream(kFile) << text;
          platform::setDeviceConfigPath(kFile);
          bool ok = platform::deviceAnswerBool("InternalBuild") == internal && !platform::deviceAnswerBool("Unknown") &&
                    platform::deviceAnswerString("DeviceClass") == deviceClass &&
                    !platform::deviceAnswerString("Unknown");
          std::ofstream(kFile) << "[device]\ninternal_build = " << (internal ? "false" : "true") << "\n";
          ok = ok && platform::deviceAnswerBool("InternalBuild") == internal;  // not read again
          fs::remove(kFile);
          std::exit(ok ? 0 : 1);
        },
        testing::ExitedWithCode(0), logged);
}

}  // namespace
