// What zlka-devserver does that the daemon's tests do not already drive through it: the rules of
// its admin interface, catalogue lookup, the state directory it generates, the requests it refuses
// before any signature, the replacement tokens it issues, and the program as a user runs it.
#include <gmock/gmock.h>
#include <httplib.h>
#include <signal.h>
#include <sys/stat.h>

#include <fstream>
#include <map>
#include <regex>
#include <thread>

#include "common/child_process.h"
#include "common/server_world.h"
#include "devserver/activation_token.h"
#include "devserver/catalog.h"
#include "devserver/dev_server.h"
#include "devserver/fault_table.h"
#include "devserver/state_dir.h"
#include "tarvexsap/tarvex_sap_certs.h"

namespace {

namespace fs = std::filesystem;
using nlohmann::json;
using testing::HasSubstr;

using zlkatest::TempDir;

std::string readText(const fs::path& file) {
  std::ifstream in(file, std::ios::binary);
  return std::string((std::istreambuf_iterator<char>(in)), {});
}

// The message of what `action` throws, "" when it throws nothing.
template <class Action>
std::string thrown(Action action) {
  try {
    action();
  } catch (const std::exception& e) {
    return e.what();
  }
  return "";
}

TEST(FaultRules, AreRefusedNamingTheWrongMember) {
  // clang-format off
  const std::pair<json, const char*> rows[] = {
      {json::array(), "a fault must be a JSON object"},
      {{{"status", 500}}, "\"endpoint\""},
      {{{"endpoint", "nowhere"}, {"status", 500}}, "\"endpoint\""},
      {{{"endpoint", "*"}}, "at least one"},                        // no fault at all
      {{{"endpoint", "*"}, {"status", "500"}}, "\"status\""},
      {{{"endpoint", "*"}, {"status", 199}}, "\"status\""},         // 200..599
      {{{"endpoint", "*"}, {"status", 500.5}}, "\"status\""},
      {{{"endpoint", "*"}, {"delay_ms", -1}}, "\"delay_ms\""},
      {{{"endpoint", "*"}, {"signature", "broken"}}, "\"signature\""},
      {{{"endpoint", "*"}, {"drop", 1}}, "\"drop\""},
      {{{"endpoint", "*"}, {"body", 5}}, "\"body\""},
      {{{"endpoint", "*"}, {"status", 500}, {"remaining", 0}}, "\"remaining\""},
      {{{"endpoint", "*"}, {"status", 500}, {"colour", "red"}}, "unknown member \"colour\""},
  };
  // clang-format on
  for (const auto& [rule, mentions] : rows) EXPECT_THAT(thrown([&] { devserver::parseFaultRule(rule); }), HasSubstr(mentions)) << rule;
  const json rule = {{"endpoint", "sapSession"}, {"status", 200}, {"signature", "corrupt"}, {"drop", true}, {"body", ""},
                     {"session_validity", nullptr}, {"session_info", "x"}, {"remaining", 1}, {"delay_ms", 5}};
  EXPECT_EQ(devserver::faultRuleToJSON(devserver::parseFaultRule(rule)), rule);
  json longDelay = devserver::faultRuleToJSON(devserver::parseFaultRule({{"endpoint", "*"}, {"delay_ms", 999999999}}));
  EXPECT_EQ(longDelay.at("delay_ms"), 120000);  // capped, not refused
}

TEST(FaultRules, AnEndpointsOwnRuleBeatsTheWildcardUntilItIsUsedUp) {
  using devserver::Endpoint;
  devserver::FaultTable table;
  table.set(devserver::parseFaultRule({{"endpoint", "*"}, {"status", 502}}));
  table.set(devserver::parseFaultRule({{"endpoint", "queryProductPlan"}, {"status", 418}, {"remaining", 2}}));
  auto status = [&](Endpoint e) { return table.take(e).value_or(devserver::Fault{}).status.value_or(0); };
  EXPECT_EQ(status(Endpoint::queryProductPlan), 418);
  EXPECT_EQ(status(Endpoint::setupCertificate), 502);
  EXPECT_EQ(status(Endpoint::queryProductPlan), 418);
  EXPECT_EQ(status(Endpoint::queryProductPlan), 502);
  EXPECT_EQ(table.toJSON(), json::parse(R"([{"endpoint": "*", "status": 502}])"));
  table.clear();
  EXPECT_FALSE(table.take(Endpoint::ackAccessory));
}

json plan(const std::string& ppid, const std::string& defaultLocale, const std::vector<std::string>& locales) {
  json metadata = json::object();
  for (const std::string& locale : locales) metadata[locale] = {{"name", ppid + " in " + locale}};
  return {{"ppid", ppid}, {"default_locale", defaultLocale}, {"metadata", metadata}};
}

TEST(Catalog, PlansAnswerInTheRequestedLocaleElseItsLanguageElseTheirDefault) {
  auto catalog = devserver::Catalog::fromJSON(
      {{"default", plan("PP", "de_DE", {"de_DE", "en_GB", "en_US", "fr_CA", "fr_FR", "ja_JP", "zh_Hans_CN"})}}, "test");
  auto other = devserver::Catalog::fromJSON({{"default", plan("PP", "en_US", {"en_AU", "en_US", "fr_FR"})}}, "test");
  const std::pair<const char*, const char*> rows[] = {
      {"en_US", "en_US"}, {"zh_Hans_CN", "zh_Hans_CN"},
      {"fr_BE", "fr_CA"},       // the first of the same language
      {"zh_Hant_TW", "zh_Hans_CN"}, {"en", "en_GB"},  // the language is what precedes the first "_"
      {"ko_KR", "de_DE"}, {"", "de_DE"}, {"_US", "de_DE"},
      {"en-US", "de_DE"},       // identifiers are not normalised
  };
  for (const auto& [requested, answered] : rows) EXPECT_EQ(catalog.fallback()->answerLocale(requested), answered) << requested;
  EXPECT_EQ(other.fallback()->answerLocale("en_IE"), "en_US");  // the default first among its language
}

TEST(Catalog, MapsTokensByTheDigestOfTheirFirstItem) {
  const std::vector<uint8_t> gold = {0x04, 0x01, 0x01}, silver = {0x04, 0x01, 0x02};
  auto catalog = devserver::Catalog::fromJSON({{"default", plan("PP-DEFAULT", "en_US", {"en_US"})},
                                               {"tokens", {{devserver::sha256Hex(gold), plan("PP-GOLD", "en_US", {"en_US"})}}}},
                                              "test");
  EXPECT_EQ(catalog.mapped(gold)->ppid, "PP-GOLD");
  EXPECT_EQ(catalog.mapped(silver), nullptr);
  EXPECT_EQ(catalog.withPPID("PP-GOLD"), catalog.mapped(gold));
  EXPECT_EQ(catalog.fallback()->ppid, "PP-DEFAULT");
  json onlyTokens = {{"tokens", {{devserver::sha256Hex(gold), plan("PP-GOLD", "en_US", {"en_US"})}}}};
  EXPECT_EQ(devserver::Catalog::fromJSON(onlyTokens, "test").fallback(), nullptr);
  EXPECT_EQ(devserver::Catalog::builtIn().fallback()->ppid, "PP-0001-ACCESSORY");
}

TEST(Catalog, InvalidCataloguesAreRefusedNamingTheMember) {
  const json good = plan("PP", "en_US", {"en_US"});
  json unknownMember = good;
  unknownMember["colour"] = 1;
  const std::pair<json, std::string> rows[] = {
      {json::array(), "top level"},
      {json::object(), "neither"},
      {{{"default", good}, {"plans", 1}}, "\"plans\""},
      {{{"default", "PP"}}, "default"},
      {{{"default", {{"default_locale", "en_US"}, {"metadata", {{"en_US", json::object()}}}}}}, "default.ppid"},
      {{{"default", plan("PP", "fr_FR", {"en_US"})}}, "fr_FR"},  // the default locale needs metadata
      {{{"default", {{"ppid", "PP"}, {"default_locale", "en_US"}, {"metadata", {{"en_US", "x"}}}}}}, "default.metadata.en_US"},
      {{{"default", plan("PP", "en_US", {"en_US", "en US"})}}, "en US"},
      {{{"default", unknownMember}}, "colour"},
      {{{"tokens", {{std::string(64, 'A'), good}}}}, "AAAA"},  // digests are lower-case hex
      {{{"tokens", {{"abc", good}}}}, "\"abc\""},
  };
  for (const auto& [document, mentions] : rows)
    EXPECT_THAT(thrown([&] { devserver::Catalog::fromJSON(document, "cat.json"); }), testing::AllOf(HasSubstr("cat.json"), HasSubstr(mentions)))
        << document;
  EXPECT_THAT(thrown([] { devserver::Catalog::fromFile("/nonexistent/cat.json"); }), HasSubstr("/nonexistent/cat.json"));
}

TEST(ActivationToken, OnlyOurOwnSignedRecordsAreRecognised) {
  const TarvexSAPKey key = TarvexSAPGenerateEd25519Key(), other = TarvexSAPGenerateEd25519Key();
  const std::vector<uint8_t> record = devserver::encodeActivationRecord({"u-ü", "PP-1", 1700000000});
  const std::vector<uint8_t> signature = devserver::signActivationRecord(record, key.get());
  EXPECT_EQ(record[0], 0x30);     // SEQUENCE
  EXPECT_EQ(signature[0], 0x04);  // OCTET STRING
  auto decoded = devserver::decodeActivationToken(record, signature, key.get());
  ASSERT_TRUE(decoded);
  EXPECT_EQ(decoded->uuid + " " + decoded->ppid + " " + std::to_string(decoded->issuedAt), "u-ü PP-1 1700000000");
  std::vector<uint8_t> longer = record;
  longer.push_back(0);
  EXPECT_FALSE(devserver::decodeActivationToken(record, signature, other.get()));
  EXPECT_FALSE(devserver::decodeActivationToken(longer, signature, key.get()));
  EXPECT_FALSE(devserver::decodeActivationToken(signature, record, key.get()));
}

const char* const kStateFiles[] = {"ca.pem",       "ca.key",    "server.pem", "server.key", "sap-root.pem",
                                   "sap-root.key", "setup.crt", "setup.pem",  "setup.key"};

std::map<std::string, std::string> snapshot(const fs::path& dir) {
  std::map<std::string, std::string> files;
  for (const char* name : kStateFiles) files[name] = readText(dir / name);
  return files;
}

TEST(StateDirectory, IsMadePrivateOnceAndThenReused) {
  TempDir parent;
  const fs::path dir = parent.path() / "nested" / "state";
  devserver::prepareStateDirectory(dir);
  auto mode = [](const fs::path& p) { struct stat s{}; return ::stat(p.c_str(), &s) == 0 ? s.st_mode & 07777 : 0; };
  EXPECT_EQ(mode(dir), 0700u);
  for (const char* key : {"ca.key", "server.key", "sap-root.key", "setup.key"}) EXPECT_EQ(mode(dir / key), 0600u) << key;
  EXPECT_TRUE(fs::is_directory(dir / "defaults") && fs::is_directory(dir / "entitlements.d"));
  const auto first = snapshot(dir);
  for (const auto& [name, text] : first) EXPECT_FALSE(text.empty()) << name;
  // The leaf serves the loopback names a client uses.
  const TarvexSAPCert server = TarvexSAPCertFromPEM(first.at("server.pem"));
  EXPECT_EQ(X509_check_ip_asc(server.get(), "::1", 0) + X509_check_host(server.get(), "localhost", 0, 0, nullptr), 2);

  devserver::prepareStateDirectory(dir);
  EXPECT_EQ(snapshot(dir), first);
  fs::remove(dir / "setup.pem");  // one form of the setup certificate is made from the other
  devserver::prepareStateDirectory(dir);
  EXPECT_EQ(snapshot(dir), first);
  fs::remove(dir / "sap-root.pem");  // an issuer made anew takes what it issued with it
  fs::remove(dir / "sap-root.key");
  devserver::prepareStateDirectory(dir);
  const auto renewed = snapshot(dir);
  EXPECT_NE(renewed.at("setup.crt"), first.at("setup.crt"));
  EXPECT_EQ(renewed.at("server.pem"), first.at("server.pem"));
}

TEST(StateDirectory, BrokenStatesAreRefusedNamingTheFile) {
  TempDir other;
  devserver::prepareStateDirectory(other.path() / "s");
  auto fromOther = [&](std::vector<const char*> names) {
    return [&other, names](const fs::path& d) {
      for (const char* n : names) fs::copy_file(other.path() / "s" / n, d / n, fs::copy_options::overwrite_existing);
    };
  };
  const std::pair<std::function<void(const fs::path&)>, const char*> rows[] = {
      {[](const fs::path& d) { fs::remove(d / "ca.key"); }, "ca.key"},
      {[](const fs::path& d) { std::ofstream(d / "server.pem") << "not a certificate"; }, "server.pem"},
      {[](const fs::path& d) { fs::copy_file(d / "ca.key", d / "server.key", fs::copy_options::overwrite_existing); }, "server.key"},
      {fromOther({"server.pem", "server.key"}), "server.pem"},             // issued by another CA
      {fromOther({"setup.crt", "setup.pem", "setup.key"}), "setup.crt"},  // issued by another root
      {fromOther({"setup.pem"}), "setup.pem"},                            // the two forms differ
      {[](const fs::path& d) { fs::remove_all(d), std::ofstream(d) << "x"; }, "is not a directory"},
  };
  for (const auto& [damage, named] : rows) {
    TempDir parent;
    devserver::prepareStateDirectory(parent.path() / "state");
    damage(parent.path() / "state");
    EXPECT_THAT(thrown([&] { devserver::prepareStateDirectory(parent.path() / "state"); }), HasSubstr(named));
  }
}

TEST(StateDirectory, TheDaemonConfigurationPointsEveryEnvironmentAtTheServer) {
  const std::string toml = devserver::daemonConfiguration("/s", "https://127.0.0.1:5");
  for (const char* environment : {"prod", "it", "ut", "maint"})
    EXPECT_THAT(toml, HasSubstr(std::string("[servers.") + environment +
                                "]\nstatic_content = \"https://127.0.0.1:5\"\napi = \"https://127.0.0.1:5\"\n"));
  for (const char* line : {"ca_file = \"/s/ca.pem\"", "trust_anchor = \"/s/sap-root.pem\"", "suite_dir = \"/s/defaults\"",
                           "dir = \"/s/entitlements.d\""})
    EXPECT_THAT(toml, HasSubstr(line));
}

TEST(DevServer, RefusesUnsignedAndMalformedRequestsInJSONAndCountsThem) {
  TempDir dir;
  devserver::DevServerOptions options;
  options.stateDir = dir.path() / "state";
  options.admin = true;
  devserver::DevServer server(options);
  ASSERT_FALSE(server.start());
  httplib::SSLClient client("127.0.0.1", server.port());
  client.set_ca_cert_path((dir.path() / "state" / "ca.pem").c_str());
  client.enable_server_certificate_verification(true);
  const httplib::Headers unknown = {{"session-identifier", "NONE"}, {"signature", "AAAA"}};
  // clang-format off
  const struct { std::function<httplib::Result()> send; int status; const char* error; } rows[] = {
      {[&] { return client.Post("/deviceservices/ackAccessory", "{}", "application/json"); }, 401, "missing session-identifier header"},
      {[&] { return client.Post("/deviceservices/ackAccessory", {{"session-identifier", "NONE"}}, "{}", "application/json"); }, 401, "missing signature header"},
      {[&] { return client.Post("/deviceservices/queryProductPlan", unknown, "{}", "application/json"); }, 401, "unknown session"},
      {[&] { return client.Post("/deviceservices/sapSession", R"({"session-request": "AAAA\n", "session-identifier": "S"})", "application/json"); }, 400, "\"session-request\" is not base64"},
      {[&] { return client.Post("/deviceservices/sapSession", R"({"session-request": "AAAA", "session-identifier": "S"})", "application/json"); }, 400, ""},
      {[&] { return client.Get("/deviceservices/nothing"); }, 404, ""},
      {[&] { return client.Get("/deviceservices/queryProductPlan"); }, 405, ""},
      {[&] { return client.Post("/deviceservices/activateAccessory", std::string(1024 * 1024 + 1, 'x'), "application/json"); }, 413, ""},
  };
  // clang-format on
  for (const auto& row : rows) {
    auto answer = row.send();
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->status, row.status) << answer->body;
    EXPECT_EQ(answer->get_header_value("Content-Type"), "application/json");
    EXPECT_THAT(json::parse(answer->body, nullptr, false).value("error", "?"), HasSubstr(row.error)) << answer->body;
    EXPECT_FALSE(answer->has_header("signature")) << answer->body;
  }
  zlkatest::AdminClient admin(server.port(), dir.path() / "state" / "ca.pem");
  json stats = admin.stats();
  EXPECT_EQ(stats.at("requests"), json::parse(R"({"setup.crt": 0, "sapSession": 2, "queryProductPlan": 2, "activateAccessory": 1, "ackAccessory": 2})"));
  EXPECT_EQ(stats.at("statuses"), json::parse(R"({"400": 2, "401": 3, "404": 1, "405": 1, "413": 1})"));
  EXPECT_EQ(stats.at("rejected"), 3);
  admin.reset();
  EXPECT_EQ(admin.stats().at("statuses"), json::object());
  EXPECT_EQ(client.Get("/_admin/reset")->status, 405);
  EXPECT_EQ(client.Put("/_admin/faults", "", "application/json")->status, 405);

}

TEST(DevServer, TheProgramServesUntilSIGTERMAndRefusesBadArguments) {
  TempDir dir;
  const fs::path state = dir.path() / "state";
  zlkatest::ChildProcess program({ZLKA_DEVSERVER_BINARY, "--listen", "127.0.0.1:0", "--state-dir", state.string()}, dir.path());
  std::smatch match;
  std::string line;
  const std::regex announced("zlka-devserver listening on https://127\\.0\\.0\\.1:([0-9]+) \\(state in (.*)\\)\n");
  for (int i = 0; i < 3000 && !std::regex_search(line = program.standardOutput(), match, announced); ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  ASSERT_FALSE(match.empty()) << line << program.standardError();
  EXPECT_EQ(match[2].str(), state.string());
  httplib::SSLClient client("127.0.0.1", std::stoi(match[1].str()));
  client.set_ca_cert_path((state / "ca.pem").c_str());
  client.enable_server_certificate_verification(true);
  auto certificate = client.Get("/deviceservices/setup.crt");
  ASSERT_TRUE(certificate);
  EXPECT_EQ(certificate->body, readText(state / "setup.crt"));
  EXPECT_EQ(client.Get("/_admin/stats")->status, 404);  // no admin interface without --admin
  program.signal(SIGTERM);
  EXPECT_EQ(program.waitExit(std::chrono::seconds(30)), 0);
  EXPECT_TRUE(std::regex_search(program.standardError(), std::regex("GET /deviceservices/setup.crt 200 [0-9.]+ ms\n")));

  std::ofstream(dir.path() / "catalog.json") << R"({"default": {"ppid": "PP"}})";
  const std::pair<std::vector<std::string>, const char*> rows[] = {
      {{"--listen", "127.0.0.1"}, "--listen"},
      {{"--session-validity", "-1"}, "--session-validity"},
      {{"--catalog", (dir.path() / "catalog.json").string()}, "default.metadata"},
      {{"--unknown"}, "--unknown"},
  };
  for (const auto& [arguments, mentions] : rows) {
    std::vector<std::string> argv = {ZLKA_DEVSERVER_BINARY, "--state-dir", state.string()};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    auto run = zlkatest::runToEnd(argv, dir.path());
    EXPECT_NE(run.status, 0) << mentions;
    EXPECT_THAT(run.err, HasSubstr(mentions));
    EXPECT_EQ(run.out, "");
  }
}

}  // namespace
