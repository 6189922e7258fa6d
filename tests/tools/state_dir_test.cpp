// The state directory: what a first start creates, what a later start reuses, and how broken
// states are reported.
#include "devserver/state_dir.h"

#include <gtest/gtest.h>
#include <openssl/x509v3.h>
#include <sys/stat.h>

#include <map>

#include "devserver_test_support.h"
#include "tarvexsap/tarvex_sap_certs.h"

namespace devtest {
namespace {

namespace fs = std::filesystem;
using devserver::DevServer;
using devserver::DevServerOptions;

const char* const kStateFiles[] = {"ca.pem",       "ca.key",    "server.pem", "server.key", "sap-root.pem",
                                   "sap-root.key", "setup.crt", "setup.pem",  "setup.key",  "zlkad.toml"};

mode_t modeOf(const fs::path& path) {
  struct stat info {};
  EXPECT_EQ(::stat(path.c_str(), &info), 0) << path;
  return info.st_mode & 07777;
}

std::map<std::string, std::string> snapshot(const fs::path& dir) {
  std::map<std::string, std::string> files;
  for (const char* name : kStateFiles) {
    files[name] = readText(dir / name);
  }
  return files;
}

// Starts a server on `dir` and returns start()'s error (nullopt when it served).
std::optional<std::string> startOn(const fs::path& dir, DevServerOptions options = {}) {
  options.stateDir = dir;
  DevServer server(std::move(options));
  auto error = server.start();
  server.stop();
  return error;
}

TEST(DevServerStateDir, FirstStartCreatesEverythingWithPrivateModes) {
  TempDir parent;
  const fs::path dir = parent.path() / "nested" / "state";
  TestServer server(DevServerOptions{}, dir);

  EXPECT_EQ(modeOf(dir), 0700u);
  for (const char* name : kStateFiles) {
    ASSERT_TRUE(fs::is_regular_file(dir / name)) << name;
    EXPECT_GT(fs::file_size(dir / name), 0u) << name;
  }
  for (const char* key : {"ca.key", "server.key", "sap-root.key", "setup.key"}) {
    EXPECT_EQ(modeOf(dir / key), 0600u) << key;
  }
  EXPECT_TRUE(fs::is_directory(dir / "defaults"));
  EXPECT_TRUE(fs::is_directory(dir / "entitlements.d"));
  // Nothing half-written is left behind.
  std::size_t entries = 0;
  for ([[maybe_unused]] const auto& entry : fs::directory_iterator(dir)) {
    ++entries;
  }
  EXPECT_EQ(entries, std::size(kStateFiles) + 2);
}

TEST(DevServerStateDir, CertificatesFormTheExpectedChains) {
  TestServer server;
  const fs::path& dir = server.stateDir();
  const TarvexSAPCert ca = TarvexSAPCertFromPEM(readText(dir / "ca.pem"));
  const TarvexSAPCert leaf = TarvexSAPCertFromPEM(readText(dir / "server.pem"));
  EXPECT_EQ(X509_check_ca(ca.get()), 1);
  EXPECT_EQ(X509_check_issued(ca.get(), leaf.get()), X509_V_OK);
  EXPECT_EQ(X509_verify(leaf.get(), X509_get0_pubkey(ca.get())), 1);
  EXPECT_EQ(X509_check_ip_asc(leaf.get(), "127.0.0.1", 0), 1);
  EXPECT_EQ(X509_check_ip_asc(leaf.get(), "::1", 0), 1);
  EXPECT_EQ(X509_check_host(leaf.get(), "localhost", 0, 0, nullptr), 1);
  EXPECT_EQ(X509_check_ip_asc(leaf.get(), "10.0.0.1", 0), 0);

  const TarvexSAPCert root = TarvexSAPCertFromPEM(readText(dir / "sap-root.pem"));
  const std::string der = readText(dir / "setup.crt");
  const TarvexSAPCert setup = TarvexSAPCertFromDER(bytesOf(der));
  EXPECT_EQ(X509_cmp(setup.get(), TarvexSAPCertFromPEM(readText(dir / "setup.pem")).get()), 0);
  EXPECT_EQ(X509_check_issued(root.get(), setup.get()), X509_V_OK);
  EXPECT_EQ(EVP_PKEY_get_base_id(X509_get0_pubkey(setup.get())), EVP_PKEY_ED25519);
  EXPECT_EQ(X509_check_private_key(setup.get(), TarvexSAPKeyFromPEM(readText(dir / "setup.key")).get()), 1);
}

TEST(DevServerStateDir, DaemonConfigurationCarriesTheRealPortAndAbsolutePaths) {
  TempDir parent;
  const fs::path dir = parent.path() / "state";
  uint16_t firstPort = 0;
  {
    TestServer server(DevServerOptions{}, dir);
    firstPort = server.server().port();
    ASSERT_NE(server.server().port(), 0);
    const std::string url = "https://127.0.0.1:" + std::to_string(server.server().port());
    EXPECT_EQ(server.server().baseURL(), url);
    const std::string toml = readText(dir / "zlkad.toml");
    for (const char* environment : {"prod", "it", "ut", "maint"}) {
      const std::string section =
          std::string("[servers.") + environment + "]\nstatic_content = \"" + url + "\"\napi = \"" + url + "\"\n";
      EXPECT_NE(toml.find(section), std::string::npos) << environment << "\n" << toml;
    }
    for (const std::string& line :
         std::vector<std::string>{"[device]\ninternal_build = false\ndevice_class = \"AccessoryHub\"\n",
                                  "[tls]\nca_file = \"" + (dir / "ca.pem").string() + "\"\n",
                                  "[sap]\ntrust_anchor = \"" + (dir / "sap-root.pem").string() + "\"\n",
                                  "[settings]\nsuite_dir = \"" + (dir / "defaults").string() + "\"\n",
                                  "[entitlements]\ndir = \"" + (dir / "entitlements.d").string() + "\"\n",
                                  "[log]\nlevel = \"default\"\nprivate_data = false\n"}) {
      EXPECT_NE(toml.find(line), std::string::npos) << line;
    }
  }
  // A restart rewrites the file with the port of the moment.
  const std::string oldURL = "https://127.0.0.1:" + std::to_string(firstPort) + "\"";
  TestServer again(DevServerOptions{}, dir);
  const std::string rewritten = readText(dir / "zlkad.toml");
  EXPECT_EQ(rewritten, devserver::daemonConfiguration(dir, again.server().baseURL()));
  if (again.server().port() != firstPort) {
    EXPECT_EQ(rewritten.find(oldURL), std::string::npos);
  }
}

TEST(DevServerStateDir, RelativeStateDirectoryIsWrittenAbsolute) {
  TempDir parent;
  const fs::path previous = fs::current_path();
  fs::current_path(parent.path());
  std::string toml;
  {
    DevServerOptions options;
    options.stateDir = "relative-state";
    DevServer server(options);
    const auto error = server.start();
    fs::current_path(previous);
    ASSERT_FALSE(error) << *error;
    EXPECT_EQ(server.stateDir(), parent.path() / "relative-state");
    toml = readText(parent.path() / "relative-state" / "zlkad.toml");
  }
  EXPECT_NE(toml.find("ca_file = \"" + (parent.path() / "relative-state" / "ca.pem").string() + "\""),
            std::string::npos);
}

TEST(DevServerStateDir, SecondStartReusesEveryCredential) {
  TempDir parent;
  const fs::path dir = parent.path() / "state";
  ASSERT_FALSE(startOn(dir));
  auto before = snapshot(dir);
  ASSERT_FALSE(startOn(dir));
  auto after = snapshot(dir);
  before.erase("zlkad.toml");
  after.erase("zlkad.toml");
  EXPECT_EQ(before, after);
}

TEST(DevServerStateDir, MissingSecondFormOfTheSetupCertificateIsRestored) {
  TempDir parent;
  const fs::path dir = parent.path() / "state";
  ASSERT_FALSE(startOn(dir));
  const auto original = snapshot(dir);
  for (const char* removed : {"setup.pem", "setup.crt"}) {
    fs::remove(dir / removed);
    ASSERT_FALSE(startOn(dir)) << removed;
    EXPECT_EQ(readText(dir / removed), original.at(removed)) << removed;
  }
}

TEST(DevServerStateDir, CertificatesWhoseIssuerIsGoneAreMadeAnew) {
  TempDir parent;
  const fs::path dir = parent.path() / "state";
  ASSERT_FALSE(startOn(dir));
  const auto original = snapshot(dir);
  fs::remove(dir / "sap-root.pem");
  fs::remove(dir / "sap-root.key");
  fs::remove(dir / "ca.pem");
  fs::remove(dir / "ca.key");
  ASSERT_FALSE(startOn(dir));
  const auto renewed = snapshot(dir);
  for (const char* name : {"ca.pem", "server.pem", "sap-root.pem", "setup.crt", "setup.key"}) {
    EXPECT_NE(renewed.at(name), original.at(name)) << name;
  }
  const TarvexSAPCert root = TarvexSAPCertFromPEM(renewed.at("sap-root.pem"));
  const TarvexSAPCert setup = TarvexSAPCertFromPEM(renewed.at("setup.pem"));
  EXPECT_EQ(X509_verify(setup.get(), X509_get0_pubkey(root.get())), 1);
}

TEST(DevServerStateDir, BrokenStatesAreRefusedNamingTheFile) {
  struct Case {
    const char* what;
    std::function<void(const fs::path&)> damage;
    const char* named;  // the file the message must name
  };
  const std::vector<Case> cases = {
      {"key removed", [](const fs::path& d) { fs::remove(d / "ca.key"); }, "ca.key"},
      {"certificate removed", [](const fs::path& d) { fs::remove(d / "sap-root.pem"); }, "sap-root.pem"},
      {"garbage certificate", [](const fs::path& d) { writeText(d / "server.pem", "not a certificate"); },
       "server.pem"},
      {"key of another certificate",
       [](const fs::path& d) { fs::copy_file(d / "ca.key", d / "server.key", fs::copy_options::overwrite_existing); },
       "server.key"},
      {"server certificate of another CA",
       [](const fs::path& d) {
         TempDir other;
         ASSERT_FALSE(startOn(other.path() / "s"));
         for (const char* name : {"server.pem", "server.key"}) {
           fs::copy_file(other.path() / "s" / name, d / name, fs::copy_options::overwrite_existing);
         }
       },
       "server.pem"},
      {"setup certificate of another root",
       [](const fs::path& d) {
         TempDir other;
         ASSERT_FALSE(startOn(other.path() / "s"));
         for (const char* name : {"setup.crt", "setup.pem", "setup.key"}) {
           fs::copy_file(other.path() / "s" / name, d / name, fs::copy_options::overwrite_existing);
         }
       },
       "setup.crt"},
      {"two different setup certificates",
       [](const fs::path& d) {
         TempDir other;
         ASSERT_FALSE(startOn(other.path() / "s"));
         fs::copy_file(other.path() / "s" / "setup.pem", d / "setup.pem", fs::copy_options::overwrite_existing);
       },
       "setup.pem"},
      {"setup key alone",
       [](const fs::path& d) {
         fs::remove(d / "setup.crt");
         fs::remove(d / "setup.pem");
       },
       "setup.crt"},
      {"state directory is a file",
       [](const fs::path& d) {
         fs::remove_all(d);
         writeText(d, "x");
       },
       "state"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    TempDir parent;
    const fs::path dir = parent.path() / "state";
    ASSERT_FALSE(startOn(dir));
    c.damage(dir);
    const auto error = startOn(dir);
    ASSERT_TRUE(error);
    EXPECT_NE(error->find(c.named), std::string::npos) << *error;
  }
}

}  // namespace
}  // namespace devtest
