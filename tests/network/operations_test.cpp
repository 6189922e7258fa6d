// Each operation's own steps: its endpoint and request body, what it takes from the answer, its
// own argument checks; and the entitlement gate, which comes before all of them.
#include "common/rows.h"
#include "network/zlka_network_constants.h"
#include "network_fixture.h"
#include "platform/base64.h"

namespace nettest {
namespace {

std::string base64(const Data& data) { return platform::base64Encode(data.span()); }

TEST_F(NetworkTest, TheQuerySendsTokensUUIDLocaleAndRequestInfoAndTakesTheThreeAnswers) {
  const Data first = sampleToken("first"), second = derItem(0x04, std::string(200, 'x'));  // a long-form length
  std::vector<uint8_t> token = first.toVector();
  for (uint8_t b : second.toVector()) token.push_back(b);
  admin().setFault({{"endpoint", "queryProductPlan"},
                    {"body", R"({"ppid":"PP-9","locale":"es_ES","ppid_metadata":{"name":"Base"},"extra":[1,2]})"}});
  const platform::Dictionary info{{"serial", "A1B2"}, {"nested", platform::Dictionary{{"ratio", 0.5}}}};
  const Outcome outcome = run({.token = Data(token), .locale = "fr_FR", .requestInfo = info});
  ASSERT_FALSE(outcome.error) << log().dump();
  EXPECT_EQ(outcome.ppid, "PP-9");
  EXPECT_EQ(outcome.locale, platform::Locale("es_ES"));  // any known locale, not only the one asked for
  EXPECT_EQ(outcome.metadata, (platform::Dictionary{{"name", "Base"}}));
  EXPECT_EQ(uploadedBody(), (json{{"tokens", {base64(first), base64(second)}},
                                  {"uuid", kUUID},
                                  {"locale", "fr_FR"},
                                  {"request_info", {{"serial", "A1B2"}, {"nested", {{"ratio", 0.5}}}}}}));
}

TEST_F(NetworkTest, ActivationSendsTokensAndUUIDAndJoinsTheTwoPieces) {
  admin().setFault({{"endpoint", "activateAccessory"}, {"body", R"({"status":"ok","tokens":["AQID","BAU="]})"}});
  const Outcome outcome = run({.op = Op::activation, .uuid = ""});
  ASSERT_FALSE(outcome.error) << log().dump();
  EXPECT_EQ(outcome.newToken, Data(std::vector<uint8_t>{1, 2, 3, 4, 5}));
  EXPECT_EQ(uploadedBody(), (json{{"tokens", {base64(sampleToken())}}, {"uuid", ""}}));
}

// The confirmation is judged by its status alone: the server's own 204, or 200 whatever the body
// and signature; its answer is never verified or read.
TEST_F(NetworkTest, ConfirmationSendsTokensAndUUIDAndTakesEitherSuccessStatus) {
  EXPECT_FALSE(run({.op = Op::confirmation}).error) << log().dump();
  EXPECT_EQ(admin().stats()["statuses"].value("204", uint64_t{0}), 1u);
  EXPECT_EQ(uploadedBody(), (json{{"tokens", {base64(sampleToken())}}, {"uuid", kUUID}}));
  // Compact, and the same bytes where they are signed and where they are sent.
  EXPECT_EQ(
      log().count(LogLevel::Debug, "[#TokenAuth] requestData (string): " + uploadedBody().value_or(json()).dump()), 2);
  admin().setFault({{"endpoint", "ackAccessory"}, {"status", 200}, {"body", "not json"}, {"signature", "missing"}});
  const Outcome outcome = run({.op = Op::confirmation});
  EXPECT_FALSE(outcome.error) << log().dump();
  EXPECT_EQ(outcome.replies, 1);
  EXPECT_EQ(log().countStartingWith("[#TarvexSAPSession] Verifying signature..."), 0);
}

struct AnswerRow {
  const char* name;
  Op op;
  const char* body;  // properly signed by the server
  std::string line;  // its start, at error level
};

const std::string kBadMetadata = "[#TokenAuth] Invalid JSON response received from server! ";
const std::string kBadLocale = "[#TokenAuth] Invalid locale received from server: ";
const std::string kBadAnswer = "[#TokenAuth] Invalid response dictionary received from server! (responseDict.count: ";
const std::string kBadPieces = "[#TokenAuth] Invalid token array received from server - newTokenArray: ";

// clang-format off
const AnswerRow kAnswers[] = {
  {"QueryAnswerIsAnArray", Op::metadata, R"(["PP-1","en_US",{}])", kBadMetadata},
  {"NoPPID", Op::metadata, R"({"locale":"en_US","ppid_metadata":{}})", kBadMetadata},
  {"NoLocale", Op::metadata, R"({"ppid":"PP-1","ppid_metadata":{}})", kBadMetadata},
  {"NoMetadata", Op::metadata, R"({"ppid":"PP-1","locale":"en_US"})", kBadMetadata},
  {"PPIDNotAString", Op::metadata, R"({"ppid":7,"locale":"en_US","ppid_metadata":{}})", kBadMetadata},
  {"MetadataNotAnObject", Op::metadata, R"({"ppid":"PP-1","locale":"en_US","ppid_metadata":"x"})", kBadMetadata},
  {"UnknownLocale", Op::metadata, R"({"ppid":"PP-1","locale":"xx_ZZ","ppid_metadata":{}})", kBadLocale + "'xx_ZZ'"},
  // Identifiers are compared exactly.
  {"LocaleInAnotherForm", Op::metadata, R"({"ppid":"PP-1","locale":"en-US","ppid_metadata":{}})", kBadLocale + "'en-US'"},
  {"LocaleNotAString", Op::metadata, R"({"ppid":"PP-1","locale":42,"ppid_metadata":{}})", kBadLocale + "'42'"},
  {"NoTokens", Op::activation, R"({"token":["AQID","BAU="]})", kBadAnswer + "1,"},
  {"TokensNotAnArray", Op::activation, R"({"tokens":"AQID","uuid":"u"})", kBadAnswer + "2,"},
  {"ActivationAnswerIsAnArray", Op::activation, R"(["AQID","BAU="])", kBadAnswer + "2,"},
  {"OnePiece", Op::activation, R"({"tokens":["AQID"]})", kBadPieces + "[\"AQID\"], newTokenArray.count: 1!"},
  {"ThreePieces", Op::activation, R"({"tokens":["AQID","BAU=","Bg=="]})", kBadPieces + "[\"AQID\", \"BAU=\", \"Bg==\"], newTokenArray.count: 3!"},
  {"PiecesNotStrings", Op::activation, R"({"tokens":[1,2]})", kBadPieces + "[1, 2], newTokenArray.count: 2!"},
};
// clang-format on

class AnswerTest : public NetworkTest, public ::testing::WithParamInterface<AnswerRow> {};

TEST_P(AnswerTest, IsAServerError) {
  admin().setFault({{"endpoint", GetParam().op == Op::metadata ? "queryProductPlan" : "activateAccessory"},
                    {"body", GetParam().body}});
  const Outcome outcome = run({.op = GetParam().op});
  expectFailure(outcome, ZLKAErrorServer);
  expectLine(LogLevel::Error, GetParam().line, outcome.logStart);
}

ZLKA_ROWS(AnswerTest, AnswerRow, kAnswers);

struct ArgumentRow {
  const char* name;
  Call call;
  std::string line;  // logged at default level, if any
};

// clang-format off
const ArgumentRow kArguments[] = {
  {"QueryWithoutToken", {.token = std::nullopt}, ""},
  {"QueryWithoutUUID", {.uuid = std::nullopt}, ""},
  {"QueryWithoutLocale", {.locale = std::nullopt}, ""},
  {"QueryForAnUnknownLocale", {.locale = "xx_ZZ"}, "[#TokenAuth] Invalid locale identifier: xx_ZZ"},
  // Identifiers are compared exactly.
  {"QueryForALocaleInAnotherForm", {.locale = "en-US"}, "[#TokenAuth] Invalid locale identifier: en-US"},
  {"ActivationWithoutToken", {.op = Op::activation, .token = std::nullopt}, ""},
  {"ActivationWithoutUUID", {.op = Op::activation, .uuid = std::nullopt}, ""},
  {"ConfirmationWithoutToken", {.op = Op::confirmation, .token = std::nullopt}, ""},
  {"ConfirmationWithoutUUID", {.op = Op::confirmation, .uuid = std::nullopt}, ""},
};
// clang-format on

class ArgumentTest : public NetworkTest, public ::testing::WithParamInterface<ArgumentRow> {};

// Checked before the forced network failure and before any traffic.
TEST_P(ArgumentTest, IsAnInvalidParameter) {
  suite().set(ZLKAUserDefaultsKey_ForceNetworkFailure, true);
  expectFailure(run(GetParam().call), ZLKAErrorInvalidParameter);
  if (!GetParam().line.empty()) {
    EXPECT_EQ(log().count(LogLevel::Default, GetParam().line), 1) << log().dump();
  }
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Forcing"), 0);
  EXPECT_EQ(admin().requests(), 0u);
}

ZLKA_ROWS(ArgumentTest, ArgumentRow, kArguments);

// A peer without "token-auth" in the service's entitlement is refused before its arguments are
// looked at and before any traffic; its arrival line keeps token and uuid private. Which
// entitlement values grant the category is the support library's rule.
TEST_F(NetworkTest, TheEntitlementGateComesBeforeArgumentsAndTraffic) {
  platform::LogSettings settings = platform::currentLogSettings();
  settings.privateData = false;
  platform::configureLog(settings);
  for (const std::optional<Value>& entitlement :
       {std::optional<Value>(), std::optional(Value(platform::Array{Value("token-admin")}))}) {
    auto outsider = peer(entitlement);
    for (Op op : {Op::metadata, Op::activation, Op::confirmation}) {
      expectFailure(run({.op = op, .uuid = std::nullopt, .locale = "xx_ZZ"}, outsider.get()),
                    ZLKAErrorMissingEntitlement);
    }
  }
  settings.privateData = true;
  platform::configureLog(settings);
  for (const char* line :
       {"Requesting PPID metadata for token: <private> (token.length: 19, uuid: <private>, requestedLocale: xx_ZZ)",
        "Requesting activation for token: <private> (token.length: 19, uuid: <private>)",
        "Confirming activation for token: <private> (token.length: 19, uuid: <private>)"})
    EXPECT_EQ(log().count(LogLevel::Default, std::string("[#TokenAuth] ") + line), 2) << log().dump();
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Invalid locale identifier"), 0);
  EXPECT_EQ(admin().requests(), 0u);

  // A call that arrives with no connection being served has no peer to admit: refused at once.
  std::optional<Outcome> outcome;
  start({.op = Op::confirmation}, [&](Outcome o) { outcome = o; });
  ASSERT_TRUE(outcome);
  EXPECT_EQ(outcome->error, ZLKA_errorWithDomain(ZLKATokenManagerErrorDomain, ZLKAErrorMissingEntitlement));
}

}  // namespace
}  // namespace nettest
