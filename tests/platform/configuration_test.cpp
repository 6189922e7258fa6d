#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/configuration.h"

namespace {

class ConfigurationTest : public testing::Test {
 protected:
  std::filesystem::path dir = std::filesystem::temp_directory_path() / ("zlka-config-" + std::to_string(getpid()));
  std::filesystem::path file = dir / "zlkad.toml";
  void SetUp() override { std::filesystem::create_directories(dir); }
  void TearDown() override { std::filesystem::remove_all(dir); }

  std::optional<platform::Configuration> load(const std::string& text, std::string* error) {
    std::ofstream(file) << text;
    return platform::loadConfiguration(file, error);
  }
};

const char kMinimal[] = R"(
[device]
internal_build = true
device_class = "AccessoryHub"
[servers.prod]
static_content = "https://static.example.net/"
api = "https://api.example.net:8443"
[sap]
trust_anchor = "/etc/zlka/sap-root.pem"
)";

}  // namespace

TEST_F(ConfigurationTest, MinimalFileGetsDefaultsForOptionalKeys) {
  std::string error;
  auto c = load(kMinimal, &error);
  ASSERT_TRUE(c) << error;
  EXPECT_TRUE(c->device.internalBuild);
  EXPECT_EQ(c->device.deviceClass, "AccessoryHub");
  EXPECT_EQ(c->servers.at("prod").staticContent, "https://static.example.net");  // trailing slash dropped
  EXPECT_EQ(c->servers.at("prod").api, "https://api.example.net:8443");
  EXPECT_EQ(c->servers.count("it"), 0u);
  EXPECT_EQ(c->caFile, "");
  EXPECT_EQ(c->settingsDirectory, "/var/lib/zlka/defaults");
  EXPECT_EQ(c->entitlementsDirectory, "/etc/zlka/entitlements.d");
  EXPECT_EQ(c->logLevel, platform::LogLevel::Default);
  EXPECT_FALSE(c->privateData);
  EXPECT_TRUE(c->warnings.empty());
}

TEST_F(ConfigurationTest, FullFileAndUnknownKeysAreReported) {
  std::string error;
  auto c = load(std::string(kMinimal) + R"(
[servers.ut]
static_content = "https://ut-static.example.net"
api = "https://ut-api.example.net"
[tls]
ca_file = "/tmp/ca.pem"
[settings]
suite_dir = "/tmp/defaults"
[log]
level = "debug"
private_data = true
colour = "blue"
[extra]
x = 1
)",
                &error);
  ASSERT_TRUE(c) << error;
  EXPECT_EQ(c->servers.at("ut").api, "https://ut-api.example.net");
  EXPECT_EQ(c->caFile, "/tmp/ca.pem");
  EXPECT_EQ(c->logLevel, platform::LogLevel::Debug);
  EXPECT_TRUE(c->privateData);
  ASSERT_EQ(c->warnings.size(), 2u);
  EXPECT_NE(c->warnings[0].find("'extra'"), std::string::npos);
  EXPECT_NE(c->warnings[1].find("'log.colour'"), std::string::npos);
}

TEST_F(ConfigurationTest, ErrorsNameTheFileAndTheKey) {
  struct Case {
    std::string text;
    std::string key;
  };
  std::string noDevice = kMinimal;
  noDevice.replace(noDevice.find("internal_build = true\n"), 22, "");
  std::string badURL = kMinimal;
  badURL.replace(badURL.find("https://api.example.net:8443"), 28, "http://api.example.net");
  std::string pathURL = kMinimal;
  pathURL.replace(pathURL.find("https://api.example.net:8443"), 28, "https://api.example.net/v1");
  std::string wrongType = kMinimal;
  wrongType.replace(wrongType.find("internal_build = true"), 21, "internal_build = \"yes\"");
  const Case cases[] = {
      {noDevice, "device.internal_build"},
      {badURL, "servers.prod.api"},
      {pathURL, "servers.prod.api"},
      {wrongType, "device.internal_build"},
      {std::string(kMinimal) + "[servers.it]\napi = \"https://it.example.net\"\n", "servers.it.static_content"},
      {std::string(kMinimal) + "[log]\nlevel = \"verbose\"\n", "log.level"},
      {"[device]\ninternal_build = false\ndevice_class = \"x\"\n[sap]\ntrust_anchor = \"/a\"\n", "servers.prod"},
  };
  for (const Case& c : cases) {
    std::string error;
    EXPECT_FALSE(load(c.text, &error)) << c.key;
    EXPECT_NE(error.find(file.string()), std::string::npos) << error;
    EXPECT_NE(error.find(c.key), std::string::npos) << error;
  }
}

TEST_F(ConfigurationTest, MissingAndUnparsableFilesAreErrors) {
  std::string error;
  EXPECT_FALSE(platform::loadConfiguration(dir / "absent.toml", &error));
  EXPECT_NE(error.find("absent.toml"), std::string::npos);
  EXPECT_FALSE(load("[device\n", &error));
  EXPECT_NE(error.find("zlkad.toml:1"), std::string::npos) << error;
}

TEST(BaseURL, OnlyAbsoluteHttpsWithoutPath) {
  EXPECT_EQ(platform::normalizedBaseURL("https://h"), "https://h");
  EXPECT_EQ(platform::normalizedBaseURL("https://127.0.0.1:4443/"), "https://127.0.0.1:4443");
  EXPECT_EQ(platform::normalizedBaseURL("https://[::1]:4443"), "https://[::1]:4443");
  for (const char* bad : {"", "h", "http://h", "https://", "https://h/p", "https://h?q=1", "https://u:p@h", "ftp://h"})
    EXPECT_FALSE(platform::normalizedBaseURL(bad)) << bad;
}
