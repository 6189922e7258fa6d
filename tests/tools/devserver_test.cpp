// What zlka-devserver does that the daemon's tests do not already drive through it: the rules of
// its admin interface, the replacement tokens it recognises, the privacy of its state directory,
// the requests it refuses before any signature, and the program as a user runs it.
#include <gmock/gmock.h>
#include <httplib.h>
#include <signal.h>
#include <sys/stat.h>

#include <fstream>
#include <regex>
#include <thread>

#include "common/child_process.h"
#include "devserver/activation_token.h"
#include "devserver/dev_server.h"
#include "devserver/fault_table.h"
#include "devserver/state_dir.h"
#include "tarvexsap/tarvex_sap_certs.h"

namespace {

namespace fs = std::filesystem;
using nlohmann::json;
using testing::HasSubstr;

TEST(FaultRules, AreRefusedNamingTheWrongMemberAndTheEndpointsOwnBeatsTheWildcardUntilUsedUp) {
  // clang-format off
  const std::pair<json, const char*> rows[] = {
      {json::array(), "a fault must be a JSON object"}, {{{"status", 500}}, "\"endpoint\""},
      {{{"endpoint", "nowhere"}, {"status", 500}}, "\"endpoint\""}, {{{"endpoint", "*"}}, "at least one"},
      {{{"endpoint", "*"}, {"status", 199}}, "\"status\""}, {{{"endpoint", "*"}, {"delay_ms", -1}}, "\"delay_ms\""},
      {{{"endpoint", "*"}, {"signature", "broken"}}, "\"signature\""}, {{{"endpoint", "*"}, {"drop", 1}}, "\"drop\""},
      {{{"endpoint", "*"}, {"status", 500}, {"remaining", 0}}, "\"remaining\""},
      {{{"endpoint", "*"}, {"status", 500}, {"colour", "red"}}, "unknown member \"colour\""},
  };
  // clang-format on
  for (const auto& [rule, mentions] : rows) {
    const auto parsed = devserver::parseFaultRule(rule);
    EXPECT_THAT(parsed ? "accepted" : parsed.error(), HasSubstr(mentions)) << rule;
  }
  EXPECT_EQ(devserver::parseFaultRule({{"endpoint", "*"}, {"delay_ms", 999999999}})->fault.delay,
            devserver::kLongestFaultDelay);

  devserver::FaultTable table;
  table.set(*devserver::parseFaultRule({{"endpoint", "*"}, {"status", 502}}));
  table.set(*devserver::parseFaultRule({{"endpoint", "queryProductPlan"}, {"status", 418}, {"remaining", 2}}));
  std::vector<int> statuses;
  for (auto e : {devserver::Endpoint::queryProductPlan, devserver::Endpoint::setupCertificate,
                 devserver::Endpoint::queryProductPlan, devserver::Endpoint::queryProductPlan})
    statuses.push_back(table.take(e).value_or(devserver::Fault{}).status.value_or(0));
  EXPECT_EQ(statuses, (std::vector<int>{418, 502, 418, 502}));
  table.clear();
  EXPECT_FALSE(table.take(devserver::Endpoint::ackAccessory));
}

TEST(ActivationToken, OnlyOurOwnSignedRecordsAreRecognised) {
  const TarvexSAPKey key = *TarvexSAPGenerateEd25519Key(), other = *TarvexSAPGenerateEd25519Key();
  const std::vector<uint8_t> record = *devserver::encodeActivationRecord({"u-ü", "PP-1", 1700000000});
  const std::vector<uint8_t> signature = *devserver::signActivationRecord(record, key.get());
  auto decoded = devserver::decodeActivationToken(record, signature, key.get());
  ASSERT_TRUE(decoded);
  EXPECT_EQ(decoded->uuid + " " + decoded->ppid + " " + std::to_string(decoded->issuedAt), "u-ü PP-1 1700000000");
  std::vector<uint8_t> longer = record;
  longer.push_back(0);
  EXPECT_FALSE(devserver::decodeActivationToken(record, signature, other.get()));
  EXPECT_FALSE(devserver::decodeActivationToken(longer, signature, key.get()));
  EXPECT_FALSE(devserver::decodeActivationToken(signature, record, key.get()));
}

TEST(StateDirectory, IsMadePrivateOnceAndThenReused) {
  zlkatest::TempDir parent;
  const fs::path dir = parent.path() / "nested" / "state";
  auto contents = [&dir] {
    std::string all;
    for (const char* name :
         {"ca.pem", "ca.key", "server.pem", "server.key", "sap-root.pem", "sap-root.key", "setup.crt", "setup.key"})
      all += "|" + zlkatest::readFile(dir / name);
    return all;
  };
  auto mode = [](const fs::path& p) {
    struct stat s {};
    return ::stat(p.c_str(), &s) == 0 ? s.st_mode & 07777 : 0;
  };
  ASSERT_TRUE(devserver::prepareStateDirectory(dir));
  EXPECT_EQ(mode(dir), 0700u);
  for (const char* key : {"ca.key", "server.key", "sap-root.key", "setup.key"})
    EXPECT_EQ(mode(dir / key), 0600u) << key;
  const std::string first = contents();
  EXPECT_THAT(first + "|", testing::Not(HasSubstr("||")));  // none is empty
  ASSERT_TRUE(devserver::prepareStateDirectory(dir));
  EXPECT_EQ(contents(), first);
}

TEST(DevServer, RefusesUnsignedAndMalformedRequestsInJSONWithoutASignature) {
  zlkatest::TempDir dir;
  devserver::DevServerOptions options;
  options.stateDir = dir.path() / "state";
  devserver::DevServer server(options);
  ASSERT_FALSE(server.start());
  httplib::SSLClient client("127.0.0.1", server.port());
  client.set_ca_cert_path((dir.path() / "state" / "ca.pem").c_str());
  client.enable_server_certificate_verification(true);
  // clang-format off
  const struct { const char* path; httplib::Headers headers; std::string body; int status; const char* error; } rows[] = {
      {"ackAccessory", {}, "{}", 401, "missing session-identifier header"},
      {"ackAccessory", {{"session-identifier", "NONE"}}, "{}", 401, "missing signature header"},
      {"queryProductPlan", {{"session-identifier", "NONE"}, {"signature", "AAAA"}}, "{}", 401, "unknown session"},
      {"sapSession", {}, R"({"session-request": "AAAA\n", "session-identifier": "S"})", 400, "\"session-request\" is not base64"},
      {"nothing", {}, "{}", 404, ""},
      {"activateAccessory", {}, std::string(1024 * 1024 + 1, 'x'), 413, ""},
  };
  // clang-format on
  for (const auto& row : rows) {
    auto answer = client.Post(std::string("/deviceservices/") + row.path, row.headers, row.body, "application/json");
    ASSERT_TRUE(answer);
    EXPECT_EQ(answer->status, row.status) << answer->body;
    EXPECT_EQ(answer->get_header_value("Content-Type"), "application/json");
    EXPECT_THAT(json::parse(answer->body, nullptr, false).value("error", "?"), HasSubstr(row.error)) << answer->body;
    EXPECT_FALSE(answer->has_header("signature")) << answer->body;
  }
  EXPECT_EQ(client.Get("/deviceservices/queryProductPlan")->status, 405);
  EXPECT_EQ(client.Get("/_admin/stats")->status, 404);  // no admin interface unless asked for
}

TEST(DevServer, TheProgramServesUntilSIGTERMAndRefusesBadArguments) {
  zlkatest::TempDir dir;
  const fs::path state = dir.path() / "state";
  zlkatest::ChildProcess program({ZLKA_DEVSERVER_BINARY, "--listen", "127.0.0.1:0", "--state-dir", state.string()},
                                 dir.path());
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
  EXPECT_EQ(certificate->body, zlkatest::readFile(state / "setup.crt"));
  program.signal(SIGTERM);
  EXPECT_EQ(program.waitExit(std::chrono::seconds(30)), 0);
  EXPECT_TRUE(std::regex_search(program.standardError(), std::regex("GET /deviceservices/setup.crt 200 [0-9.]+ ms\n")));

  std::ofstream(dir.path() / "catalog.json") << R"({"default": {"ppid": "PP"}})";
  const std::pair<std::vector<std::string>, const char*> rows[] = {
      {{"--listen", "127.0.0.1"}, "--listen"},
      {{"--catalog", (dir.path() / "catalog.json").string()}, "default.metadata"},
      {{"--unknown"}, "--unknown"},
  };
  for (const auto& [arguments, mentions] : rows) {
    std::vector<std::string> argv = {ZLKA_DEVSERVER_BINARY, "--state-dir", state.string()};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    auto run = zlkatest::runToEnd(argv, dir.path());
    EXPECT_NE(run.status, 0) << mentions;
    EXPECT_THAT(run.err, HasSubstr(mentions));
  }
}

}  // namespace
