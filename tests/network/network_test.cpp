// ZLKANetwork on an internal build against zlka-devserver: the request pipeline shared by the three
// operations (once, over the metadata query), each operation's own steps, the entitlement gate,
// the developer controls, and the session's two network legs.
#include <cmath>

#include "network_fixture.h"
#include "platform/http/http_session.h"
#include "platform/values/base64.h"

namespace nettest {
namespace {

[[maybe_unused]] ::testing::Environment* const kWorld =
    ::testing::AddGlobalTestEnvironment(new zlkatest::ServerWorld(true));

std::string base64(const Data& data) { return platform::base64Encode(data.span()); }

const std::string kStatus = "[#TokenAuth] Server responded with invalid HTTP status code: ";
const std::string kTask = "[#TokenAuth] taskError: ";
const std::string kSigning = "[#TokenAuth] tarvexError: ";
const std::string kEmpty = "[#TokenAuth] responseData is empty!";
const std::string kBadAnswer = "[#TokenAuth] Invalid response dictionary received from server! (responseDict.count: ";

const std::string kBadMetadata = "[#TokenAuth] Invalid JSON response received from server! ";
const std::string kBadLocale = "[#TokenAuth] Invalid locale received from server: ";
const std::string kBadPieces = "[#TokenAuth] Invalid token array received from server - newTokenArray: ";
const std::string kBadLocaleArgument = "[#TokenAuth] Invalid locale identifier: ";
const char kNetwork[] = "[#TokenAuth] Forcing network failure...";
const char* const kEndpoints[] = {"queryProductPlan", "activateAccessory", "ackAccessory"};  // by Op
const std::vector<const char*> kForceNetwork = {ZLKAUserDefaultsKey_ForceNetworkFailure};
const char* const kForceActivation = ZLKAUserDefaultsKey_ForceTokenActivationFailure;
const char* const kForceConfirmation = ZLKAUserDefaultsKey_ForceTokenConfirmationFailure;
constexpr LogLevel kErr = LogLevel::Error, kDef = LogLevel::Default;
const Call kActivation{.op = Op::activation}, kConfirmation{.op = Op::confirmation};
const Data kNotDER = Data::fromString("not DER");

// How one call ends, with the code the caller gets and the line that names the cause.
struct CallRow {
  const char* name;
  std::vector<const char*> switches;  // turned on in the suite
  json fault;                         // on the call's own endpoint unless it names another
  Call call;
  int64_t code;  // 0: success
  LogLevel level;
  std::string line;  // its start, if any
};

// clang-format off
const CallRow kCalls[] = {
  // The pipeline shared by the three operations, over the metadata query.
  {"Status400", {}, {{"status", 400}, {"body", "{\"error\":\"bad\"}"}}, {}, ZLKAErrorInvalidParameter, kErr, kStatus + "400!\nresponseData (string): {\"error\":\"bad\"}"},
  {"Status401", {}, {{"status", 401}}, {}, ZLKAErrorInternal, kErr, kStatus + "401!"},
  {"Status201", {}, {{"status", 201}}, {}, ZLKAErrorServer, kErr, kStatus + "201!"},
  // Only the confirmation takes 204 for success.
  {"Status204", {}, {{"status", 204}}, {}, ZLKAErrorServer, kErr, kStatus + "204!"},
  {"Status500", {}, {{"status", 500}}, {}, ZLKAErrorServer, kErr, kStatus + "500!"},
  {"EmptyBody", {}, {{"body", ""}}, {}, ZLKAErrorServer, kDef, kEmpty},
  {"SignatureMissing", {}, {{"signature", "missing"}}, {}, ZLKAErrorServer, kErr, kSigning},
  {"SignatureCorrupt", {}, {{"signature", "corrupt"}}, {}, ZLKAErrorServer, kErr, kSigning},
  {"BodyNotJSON", {}, {{"body", "ppid=PP-1"}}, {}, ZLKAErrorServer, kErr, "[#TokenAuth] responseJSONError: "},
  {"ConnectionDropped", {}, {{"drop", true}, {"remaining", 1}}, {}, ZLKAErrorNetwork, LogLevel::Fault, kTask},
  // Optional white space around a header value is not part of it.
  {"SignatureHeaderPadded", {}, {{"signature", "padded"}}, {}, 0, kDef, ""},
  // A session that cannot open: its transport and bad-answer codes keep their meaning, the rest is internal.
  {"SessionTransportFails", {}, {{"endpoint", "setup.crt"}, {"drop", true}}, {}, ZLKAErrorNetwork, kErr, kSigning},
  {"SessionAnswerBad", {}, {{"endpoint", "sapSession"}, {"status", 503}}, {}, ZLKAErrorServer, kErr, kSigning},
  {"SessionRefusedByThePrimitives", {}, {{"endpoint", "sapSession"}, {"session_info", "AAAA"}}, {}, ZLKAErrorInternal, kErr, kSigning},
  // Requests that cannot be built are never sent.
  {"TokenNotDER", {}, nullptr, {.token = Data::fromString("plain text")}, ZLKAErrorInvalidParameter, LogLevel::Info, "[#TokenAuth] tokenArray.count: 0"},
  {"RequestInfoNotJSON", {}, nullptr, {.requestInfo = platform::Dictionary{{"ratio", NAN}}}, ZLKAErrorInternal, kErr, "[#TokenAuth] isValidJSONObject (requestDict) = NO!"},
  // Answers, properly signed, that the operation cannot take.
  {"QueryAnswerIsAnArray", {}, {{"body", R"(["PP-1","en_US",{}])"}}, {}, ZLKAErrorServer, kErr, kBadMetadata},
  {"NoPPID", {}, {{"body", R"({"locale":"en_US","ppid_metadata":{}})"}}, {}, ZLKAErrorServer, kErr, kBadMetadata},
  {"NoLocale", {}, {{"body", R"({"ppid":"PP-1","ppid_metadata":{}})"}}, {}, ZLKAErrorServer, kErr, kBadMetadata},
  {"NoMetadata", {}, {{"body", R"({"ppid":"PP-1","locale":"en_US"})"}}, {}, ZLKAErrorServer, kErr, kBadMetadata},
  {"PPIDNotAString", {}, {{"body", R"({"ppid":7,"locale":"en_US","ppid_metadata":{}})"}}, {}, ZLKAErrorServer, kErr, kBadMetadata},
  {"MetadataNotAnObject", {}, {{"body", R"({"ppid":"PP-1","locale":"en_US","ppid_metadata":"x"})"}}, {}, ZLKAErrorServer, kErr, kBadMetadata},
  {"UnknownLocale", {}, {{"body", R"({"ppid":"PP-1","locale":"xx_ZZ","ppid_metadata":{}})"}}, {}, ZLKAErrorServer, kErr, kBadLocale + "'xx_ZZ'"},
  {"LocaleNotAString", {}, {{"body", R"({"ppid":"PP-1","locale":42,"ppid_metadata":{}})"}}, {}, ZLKAErrorServer, kErr, kBadLocale + "'42'"},
  {"NoTokens", {}, {{"body", R"({"token":["AQID","BAU="]})"}}, kActivation, ZLKAErrorServer, kErr, kBadAnswer + "1,"},
  {"TokensNotAnArray", {}, {{"body", R"({"tokens":"AQID","uuid":"u"})"}}, kActivation, ZLKAErrorServer, kErr, kBadAnswer + "2,"},
  {"ActivationAnswerIsAnArray", {}, {{"body", R"(["AQID","BAU="])"}}, kActivation, ZLKAErrorServer, kErr, kBadAnswer + "2,"},
  {"OnePiece", {}, {{"body", R"({"tokens":["AQID"]})"}}, kActivation, ZLKAErrorServer, kErr, kBadPieces + "[\"AQID\"], newTokenArray.count: 1!"},
  {"ThreePieces", {}, {{"body", R"({"tokens":["AQID","BAU=","Bg=="]})"}}, kActivation, ZLKAErrorServer, kErr, kBadPieces + "[\"AQID\", \"BAU=\", \"Bg==\"], newTokenArray.count: 3!"},
  {"PiecesNotStrings", {}, {{"body", R"({"tokens":[1,2]})"}}, kActivation, ZLKAErrorServer, kErr, kBadPieces + "[1, 2], newTokenArray.count: 2!"},
  // Arguments are checked before the forced network failure and before any traffic.
  {"QueryWithoutToken", kForceNetwork, nullptr, {.token = std::nullopt}, ZLKAErrorInvalidParameter, kDef, ""},
  {"QueryWithoutUUID", kForceNetwork, nullptr, {.uuid = std::nullopt}, ZLKAErrorInvalidParameter, kDef, ""},
  {"QueryWithoutLocale", kForceNetwork, nullptr, {.locale = std::nullopt}, ZLKAErrorInvalidParameter, kDef, ""},
  {"QueryForAnUnknownLocale", kForceNetwork, nullptr, {.locale = "xx_ZZ"}, ZLKAErrorInvalidParameter, kDef, kBadLocaleArgument + "xx_ZZ"},
  {"ActivationWithoutToken", kForceNetwork, nullptr, {.op = Op::activation, .token = std::nullopt}, ZLKAErrorInvalidParameter, kDef, ""},
  {"ActivationWithoutUUID", kForceNetwork, nullptr, {.op = Op::activation, .uuid = std::nullopt}, ZLKAErrorInvalidParameter, kDef, ""},
  {"ConfirmationWithoutToken", kForceNetwork, nullptr, {.op = Op::confirmation, .token = std::nullopt}, ZLKAErrorInvalidParameter, kDef, ""},
  {"ConfirmationWithoutUUID", kForceNetwork, nullptr, {.op = Op::confirmation, .uuid = std::nullopt}, ZLKAErrorInvalidParameter, kDef, ""},
  // The internal build's fault-injection switches, each where it belongs; a forced failure sends nothing.
  {"NetworkFailsTheQuery", kForceNetwork, nullptr, {}, ZLKAErrorNetwork, kDef, kNetwork},
  {"NetworkFailsActivation", kForceNetwork, nullptr, kActivation, ZLKAErrorNetwork, kDef, kNetwork},
  {"NetworkFailsConfirmation", kForceNetwork, nullptr, kConfirmation, ZLKAErrorNetwork, kDef, kNetwork},
  {"NetworkComesBeforeActivation", {ZLKAUserDefaultsKey_ForceNetworkFailure, kForceActivation}, nullptr, kActivation, ZLKAErrorNetwork, kDef, kNetwork},
  {"NetworkComesBeforeConfirmation", {ZLKAUserDefaultsKey_ForceNetworkFailure, kForceConfirmation}, nullptr, kConfirmation, ZLKAErrorNetwork, kDef, kNetwork},
  // Before the token is taken apart: a blob that does not parse gets the forced failure too.
  {"ActivationFailsActivation", {kForceActivation}, nullptr, {.op = Op::activation, .token = kNotDER}, ZLKAErrorNetwork, kDef, "[#TokenAuth] Forcing token activation failure..."},
  {"ConfirmationFailsConfirmation", {kForceConfirmation}, nullptr, {.op = Op::confirmation, .token = kNotDER}, ZLKAErrorNetwork, kDef, "[#TokenAuth] Forcing token confirmation failure..."},
  {"ActivationSparesConfirmation", {kForceActivation}, nullptr, kConfirmation, 0, kDef, ""},
  {"ConfirmationSparesActivation", {kForceConfirmation}, nullptr, kActivation, 0, kDef, ""},
};
// clang-format on

class CallTest : public NetworkTest, public ::testing::WithParamInterface<CallRow> {};

TEST_P(CallTest, EndsWithItsCodeAndLine) {
  const CallRow& row = GetParam();
  for (const char* key : row.switches) suite().setObject(key, true);
  const char* endpoint = kEndpoints[static_cast<int>(row.call.op)];
  json fault = row.fault;
  const bool onTheAnswer = fault.is_object() && !fault.contains("endpoint");
  if (onTheAnswer) fault["endpoint"] = endpoint;
  if (fault.is_object()) admin().setFault(fault);
  const Outcome outcome = run(row.call);
  if (row.code) {
    expectFailure(outcome, row.code);
  } else {
    EXPECT_FALSE(outcome.error) << log().dump();
  }
  if (!row.line.empty()) expectLine(row.level, row.line, outcome.logStart);
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Forcing"), row.line.starts_with("[#TokenAuth] Forcing") ? 1 : 0)
      << log().dump();
  EXPECT_EQ(admin().requests(endpoint), onTheAnswer || !row.code ? 1u : 0u);
  EXPECT_EQ(admin().requests() == 0, fault.is_null() && row.code)
      << "only a call refused before any traffic sends nothing";
}

ZLKA_ROWS(CallTest, CallRow, kCalls);

// Signing and verifying wait 10 seconds: a primitive that does not return in time fails the
// request as internal (the wait and the request that gave up on it both log the line), and its
// late result lands nowhere.
class WaitTest : public NetworkTest, public ::testing::WithParamInterface<bool> {};

TEST_P(WaitTest, ASessionThatDoesNotAnswerInTimeIsInternal) {
  const bool verifying = GetParam();
  auto release = std::make_shared<platform::Semaphore>();
  auto used = std::make_shared<std::atomic<bool>>(false);
  TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library();
  auto hold = [release, used](auto call) {
    return [release, used, call](auto... a) {
      if (!used->exchange(true)) release->waitFor(std::chrono::seconds(120));
      return call(a...);
    };
  };
  if (verifying) primitives.verify = hold(primitives.verify);
  if (!verifying) primitives.sign = hold(primitives.sign);
  installSession(primitives);
  const Outcome outcome = run({.op = Op::activation});
  release->signal();
  expectFailure(outcome, ZLKAErrorInternal);
  const std::string what = verifying ? "verify" : "generate";
  EXPECT_EQ(log().count(LogLevel::Error, "[#TokenAuth] Timed out waiting to " + what + " Tarvex SAP signature!"), 2)
      << log().dump();
  EXPECT_EQ(admin().stat("verified"), verifying ? 1u : 0u);
  EXPECT_FALSE(run({.op = Op::confirmation}).error) << log().dump();
}

INSTANTIATE_TEST_SUITE_P(Primitives, WaitTest, ::testing::Bool(),
                         [](const auto& info) { return info.param ? "Verify" : "Sign"; });

TEST_F(NetworkTest, SignedRequestsWaitAMinute) {
  EXPECT_EQ(network()->_generateTokenAuthURLRequestForEndpoint("x", std::nullopt, std::nullopt).timeoutInterval, 60.0);
}

// An answer is verified with the association that signed its request: verifying never opens.
TEST_F(NetworkTest, VerifyingNeverOpensTheSession) {
  bool timedOut = true;
  std::optional<Error> error;
  EXPECT_FALSE(
      network()->_verifyTarvexSignatureSync(Data::fromString("sig"), Data::fromString("{}"), &timedOut, &error));
  EXPECT_FALSE(timedOut);
  EXPECT_EQ(error.value_or(Error("none", 0)).code(), TarvexSAPSessionErrorInvalidState);
  EXPECT_EQ(admin().requests(), 0u);
}

TEST_F(NetworkTest, TheQuerySendsTokensUUIDLocaleAndRequestInfoAndTakesTheThreeAnswers) {
  const Data first = sampleToken("first"), second = sampleToken("second");
  admin().setFault({{"endpoint", "queryProductPlan"},
                    {"body", R"({"ppid":"PP-9","locale":"es_ES","ppid_metadata":{"name":"Base"},"extra":[1,2]})"}});
  const platform::Dictionary info{{"serial", "A1B2"}, {"nested", platform::Dictionary{{"ratio", 0.5}}}};
  const Outcome outcome = run({.token = Data::fromString(std::string(first.view()) + std::string(second.view())),
                               .locale = "fr_FR",
                               .requestInfo = info});
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
  EXPECT_FALSE(run({.op = Op::confirmation}).error) << log().dump();
  EXPECT_EQ(log().countStartingWith("[#TarvexSAPSession] Verifying signature..."), 0);
}

// A peer without "token-auth" in the service's entitlement is refused before its arguments are
// looked at and before any traffic; its arrival line keeps token and uuid private. Which
// entitlement values grant the category is the support library's rule: this peer holds the
// entitlement, but not the category, so only a gate that asks for the category refuses it.
TEST_F(NetworkTest, TheEntitlementGateComesBeforeArgumentsAndTraffic) {
  platform::LogSettings settings = platform::currentLogSettings();
  settings.privateData = false;
  platform::configureLog(settings);
  for (Op op : {Op::metadata, Op::activation, Op::confirmation})
    expectFailure(
        run({.op = op, .uuid = std::nullopt, .locale = "xx_ZZ"}, peer(Value(platform::Array{"token-admin"})).get()),
        ZLKAErrorMissingEntitlement);
  settings.privateData = true;
  platform::configureLog(settings);
  for (const char* line :
       {"Requesting PPID metadata for token: <private> (token.length: 19, uuid: <private>, requestedLocale: xx_ZZ)",
        "Requesting activation for token: <private> (token.length: 19, uuid: <private>)",
        "Confirming activation for token: <private> (token.length: 19, uuid: <private>)"})
    EXPECT_EQ(log().count(LogLevel::Default, std::string("[#TokenAuth] ") + line), 1) << log().dump();
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] Invalid locale identifier"), 0);
  EXPECT_EQ(admin().requests(), 0u);
  // A call that arrives with no connection being served has no peer to admit: refused at once.
  std::optional<Outcome> outcome;
  start({.op = Op::confirmation}, [&](Outcome o) { outcome = o; });
  ASSERT_TRUE(outcome);
  EXPECT_EQ(outcome->error, ZLKA_errorWithDomain(ZLKATokenManagerErrorDomain, ZLKAErrorMissingEntitlement));
}

// The secure-association switch puts "1234" in place of the request's signature, without opening
// the session (the server refuses it with 401), and is read again for the answer: turned on while
// the request is signed, it fails the verification of a properly signed answer.
TEST_F(NetworkTest, TheSAPSwitchReplacesEachSignature) {
  suite().setObject(ZLKAUserDefaultsKey_ForceTarvexSAPFailure, true);
  expectFailure(run(), ZLKAErrorInternal);
  EXPECT_EQ(admin().stat("rejected"), 1u);
  EXPECT_EQ(admin().stat("handshakes"), 0u);
  expectLine(LogLevel::Debug,
             "[#TokenAuth] request.allHTTPHeaderFields: {\"Accept\": \"application/json\", \"Content-Type\": "
             "\"application/json\", \"protocol-version\": \"1.0\", \"session-identifier\": \"" +
                 network()->tarvexSAPSession()->UUID().UUIDString() + "\", \"signature\": \"MTIzNA==\"}");
  suite().removeObject(ZLKAUserDefaultsKey_ForceTarvexSAPFailure);
  TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library();
  primitives.sign = [sign = primitives.sign](auto... a) {
    suite().setObject(ZLKAUserDefaultsKey_ForceTarvexSAPFailure, true);
    return sign(a...);
  };
  installSession(primitives);
  const Outcome outcome = run({.op = Op::activation});
  expectFailure(outcome, ZLKAErrorServer);
  expectLine(LogLevel::Error, kSigning, outcome.logStart);
  EXPECT_EQ(admin().stat("verified"), 1u) << "the request carried a real signature";
}

enum class Server { staticContent, sap, api };

struct SelectionRow {
  const char* name;
  std::vector<std::pair<const char*, Value>> settings;
  Server server;
  std::string expected;
  std::string fallbackFor;  // the unknown name the error line reports, if any
};

// clang-format off
const SelectionRow kSelections[] = {
  {"NothingStoredIsProductionAPI", {}, Server::api, "https://api.prod.test", ""},
  {"APINamesAnEnvironment", {{"Server", "it"}}, Server::api, "https://api.it.test", ""},
  {"StaticNamesAnEnvironment", {{"StaticContentServer", "maint"}}, Server::staticContent, "https://static.maint.test", ""},
  // An environment's secure-association server is its API server.
  {"SAPNamesAnEnvironment", {{"TarvexSAPServer", "ut"}}, Server::sap, "https://api.ut.test", ""},
  // Names are compared exactly; an unknown one falls back to production with an error line.
  {"NameInTheWrongCase", {{"Server", "UT"}}, Server::api, "https://api.prod.test", "UT"},
  {"UnknownStaticName", {{"StaticContentServer", "staging"}}, Server::staticContent, "https://static.prod.test", "staging"},
  {"Custom", {{"Server", "custom"}, {"CustomServer", "https://custom.test:8443"}}, Server::api, "https://custom.test:8443", ""},
  {"CustomWithoutBaseIsEmpty", {{"Server", "custom"}}, Server::api, "", ""},
  {"CustomNotOfferedForStatic", {{"StaticContentServer", "custom"}, {"CustomServer", "https://c.test"}}, Server::staticContent, "https://static.prod.test", "custom"},
  {"CustomNotOfferedForSAP", {{"TarvexSAPServer", "custom"}, {"CustomServer", "https://c.test"}}, Server::sap, "https://api.prod.test", "custom"},
};
// clang-format on

class SelectionTest : public NetworkTest, public ::testing::WithParamInterface<SelectionRow> {};

TEST_P(SelectionTest, PicksTheNamedServer) {
  zlkatest::ScopedConfiguration environments([](platform::Configuration& c) {
    for (std::string name : {"prod", "it", "ut", "maint"})
      c.servers[name] = {"https://static." + name + ".test", "https://api." + name + ".test"};
  });
  for (const auto& [key, value] : GetParam().settings) suite().setObject(key, value);
  const Server server = GetParam().server;
  EXPECT_EQ(server == Server::api   ? network()->_selectedAPIServer()
            : server == Server::sap ? network()->_selectedTarvexSAPServer()
                                    : network()->_selectedStaticContentServer(),
            GetParam().expected);
  const bool fallback = !GetParam().fallbackFor.empty();
  EXPECT_EQ(log().count(LogLevel::Error, "[#TokenAuth] Unknown server selected: '" + GetParam().fallbackFor +
                                             "'. Falling back to production server..."),
            fallback ? 1 : 0);
  EXPECT_EQ(log().countStartingWith("[#TokenAuth]"), fallback ? 1 : 0) << log().dump();
}

ZLKA_ROWS(SelectionTest, SelectionRow, kSelections);

// The selections decide where the traffic goes: the certificate to the static server, the
// handshake to the secure-association server, the requests to the API server. A base URL left
// empty ("custom" without "CustomServer") fails like a transport error.
TEST_F(NetworkTest, TheSelectedServersCarryTheTraffic) {
  zlkatest::ScopedConfiguration environments([](platform::Configuration& c) {
    c.servers["prod"] = c.servers["ut"] = {world().baseURL(), world().refusedURL()};
    c.servers["it"] = {world().refusedURL(), world().baseURL()};
  });
  expectFailure(run(), ZLKAErrorNetwork);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  EXPECT_EQ(admin().requests("sapSession"), 0u);
  suite().setObject("TarvexSAPServer", "it");
  suite().setObject("StaticContentServer", "it");
  expectFailure(run(), ZLKAErrorNetwork);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  suite().setObject("StaticContentServer", "ut");
  suite().setObject("Server", "custom");
  expectFailure(run({.op = Op::confirmation}), ZLKAErrorNetwork);
  EXPECT_EQ(admin().stat("handshakes"), 1u);
  suite().setObject("CustomServer", world().baseURL());
  EXPECT_FALSE(run().error) << log().dump();
  EXPECT_EQ(admin().requests("queryProductPlan"), 1u);
}

TEST_F(NetworkTest, TheSessionOpensOnceWithTheServersTimeToLive) {
  EXPECT_EQ(network()->_openTarvexSAPSession(), std::nullopt) << log().dump();
  EXPECT_EQ(network()->_openTarvexSAPSession(), std::nullopt);  // an open session is used as it is
  EXPECT_EQ(network()->tarvexSAPSession()->state(), TarvexSAPSessionStateOpen);
  expectLine(LogLevel::Debug, "[#TarvexSAPSession] Setting TTL... (TTL: 3600.000000, ");
  EXPECT_GT(network()->tarvexSAPSession()->TTL(), 3000.0);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  EXPECT_EQ(admin().stat("handshakes"), 1u);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Tarvex SAP session opened!"), 1);
  expectLine(LogLevel::Debug,
             "[#TokenAuth] request.allHTTPHeaderFields: {\"Accept\": \"application/json\", \"Content-Type\": "
             "\"application/json\", \"protocol-version\": \"1.0\"}");  // the handshake's
  // The certificate is binary: only the handshake's answer is shown as text.
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] responseData (string): "), 1) << log().dump();
}

struct LegRow {
  const char* name;
  const char* endpoint;
  json fault;
  int64_t code;  // in the session's domain
  LogLevel level;
  std::string line;  // its start
};

const char kCert[] = "setup.crt", kShake[] = "sapSession";
constexpr int64_t kBadResponse = TarvexSAPSessionErrorBadResponse;

// clang-format off
const LegRow kLegs[] = {
  {"CertificateStatus", kCert, {{"status", 404}}, kBadResponse, LogLevel::Error, kStatus + "404!"},
  {"CertificateEmpty", kCert, {{"body", ""}}, kBadResponse, LogLevel::Error, kEmpty},
  {"CertificateDropped", kCert, {{"drop", true}}, TarvexSAPSessionErrorTransport, LogLevel::Fault, kTask},
  {"HandshakeStatus", kShake, {{"status", 201}}, kBadResponse, LogLevel::Error, kStatus + "201!"},
  {"HandshakeEmpty", kShake, {{"body", ""}}, kBadResponse, LogLevel::Error, kEmpty},
  {"HandshakeDropped", kShake, {{"drop", true}}, TarvexSAPSessionErrorTransport, LogLevel::Fault, kTask},
  {"HandshakeNotJSON", kShake, {{"body", "session ok"}}, kBadResponse, LogLevel::Error, "[#TokenAuth] responseJSONError: "},
  {"HandshakeAnArray", kShake, {{"body", R"([{"session-info":"AAAA"}])"}}, kBadResponse, LogLevel::Error, kBadAnswer + "1,"},
  {"NoSessionInfo", kShake, {{"body", R"({"session-validity":3600})"}}, kBadResponse, LogLevel::Error, kBadAnswer + "1,"},
  {"NoValidity", kShake, {{"body", R"({"session-info":"AAAA"})"}}, kBadResponse, LogLevel::Error, kBadAnswer + "1,"},
  {"SessionInfoNotAString", kShake, {{"body", R"({"session-info":12,"session-validity":3600})"}}, kBadResponse, LogLevel::Error, kBadAnswer + "2,"},
  {"ValidityAsText", kShake, {{"session_validity", "3600"}}, kBadResponse, LogLevel::Error, kBadAnswer + "2,"},
  {"ValidityNull", kShake, {{"session_validity", nullptr}}, kBadResponse, LogLevel::Error, kBadAnswer + "2,"},
  // Session info that is not base64 reaches the session as no answer at all.
  {"SessionInfoNotBase64", kShake, {{"session_info", "not base64!"}}, TarvexSAPSessionErrorInvalidParameter, LogLevel::Default, "[#TarvexSAPSession] Invalid handshake response received!"},
  // Empty session info is data: the primitives refuse it.
  {"SessionInfoEmpty", kShake, {{"session_info", ""}}, TarvexSAPSessionErrorInternal, LogLevel::Error, "[#TarvexSAPSession] Could not process handshake response!"},
};
// clang-format on

class LegTest : public NetworkTest, public ::testing::WithParamInterface<LegRow> {};

TEST_P(LegTest, FailsTheOpenWithItsCode) {
  json fault = GetParam().fault;
  fault["endpoint"] = GetParam().endpoint;
  admin().setFault(fault);
  const std::optional<Error> error = network()->_openTarvexSAPSession();
  ASSERT_TRUE(error) << log().dump();
  EXPECT_EQ(error->domain(), TarvexSAPSessionErrorDomain);
  EXPECT_EQ(error->code(), GetParam().code);
  // A failed task's own details travel with the transport error; a bad answer carries none.
  const bool transport = error->code() == TarvexSAPSessionErrorTransport;
  EXPECT_EQ(error->userInfo().value_or(platform::Dictionary{}).contains("FailingURL"), transport)
      << error->description();
  EXPECT_TRUE(transport || error->code() != kBadResponse || !error->userInfo()) << error->description();
  expectLine(GetParam().level, GetParam().line);
  expectLine(LogLevel::Error, "[#TokenAuth] Couldn't open Tarvex SAP session:\n");
  EXPECT_EQ(network()->tarvexSAPSession()->state(), TarvexSAPSessionStateClosed);
}

ZLKA_ROWS(LegTest, LegRow, kLegs);

// Called directly: with no completion nobody would hear the answer, so nothing is sent; no
// handshake data is an invalid parameter.
TEST_F(NetworkTest, TheLegsCheckTheirArgumentsFirst) {
  TarvexSAPSession& session = *network()->tarvexSAPSession();
  network()->sessionRequestCertificateWithCompletionHandler(session, nullptr);
  network()->sessionRequestHandshakeWithServerCompletionHandler(session, Data::fromString("x"), nullptr);
  std::optional<Error> error;
  network()->sessionRequestHandshakeWithServerCompletionHandler(session, std::nullopt,
                                                                [&](auto, auto e) { error = e; });
  EXPECT_EQ(error, Error(TarvexSAPSessionErrorDomain, TarvexSAPSessionErrorInvalidParameter));
  EXPECT_EQ(log().count(LogLevel::Error, "[#TokenAuth] handshakeData = nil!"), 1);
  EXPECT_EQ(admin().requests(), 0u);
}

}  // namespace
}  // namespace nettest
