// The request pipeline shared by the three operations, once, over the metadata query: every way
// the server's answer, the session or the request itself can fail, each with the code the caller
// gets and the line that names the cause; the waits that end by themselves; the signed request.
#include <cmath>

#include "common/rows.h"
#include "network_fixture.h"
#include "platform/base64.h"
#include "platform/http_session.h"
#include "platform/semaphore.h"

namespace nettest {
namespace {

// This binary runs as an internal build.
[[maybe_unused]] ::testing::Environment* const kWorld =
    ::testing::AddGlobalTestEnvironment(new zlkatest::ServerWorld(true));

const std::string kStatus = "[#TokenAuth] Server responded with invalid HTTP status code: ";
const std::string kTask = "[#TokenAuth] taskError: ";
const std::string kSigning = "[#TokenAuth] tarvexError: ";

struct PipelineRow {
  const char* name;
  json fault;  // on the query's endpoint unless it names another
  Call call;
  int64_t code;
  LogLevel level;
  std::string line;  // its start
};

// clang-format off
const PipelineRow kRows[] = {
  {"Status400", {{"status", 400}, {"body", "{\"error\":\"bad\"}"}}, {}, ZLKAErrorInvalidParameter, LogLevel::Error, kStatus + "400!\nresponseData (string): {\"error\":\"bad\"}"},
  {"Status401", {{"status", 401}}, {}, ZLKAErrorInternal, LogLevel::Error, kStatus + "401!"},
  {"Status201", {{"status", 201}}, {}, ZLKAErrorServer, LogLevel::Error, kStatus + "201!"},
  // Only the confirmation takes 204 for success.
  {"Status204", {{"status", 204}}, {}, ZLKAErrorServer, LogLevel::Error, kStatus + "204!"},
  {"Status500", {{"status", 500}}, {}, ZLKAErrorServer, LogLevel::Error, kStatus + "500!"},
  {"EmptyBody", {{"body", ""}}, {}, ZLKAErrorServer, LogLevel::Default, "[#TokenAuth] responseData is empty!"},
  {"SignatureMissing", {{"signature", "missing"}}, {}, ZLKAErrorServer, LogLevel::Error, kSigning},
  {"SignatureCorrupt", {{"signature", "corrupt"}}, {}, ZLKAErrorServer, LogLevel::Error, kSigning},
  {"BodyNotJSON", {{"body", "ppid=PP-1"}}, {}, ZLKAErrorServer, LogLevel::Error, "[#TokenAuth] responseJSONError: "},
  {"ConnectionDropped", {{"drop", true}, {"remaining", 1}}, {}, ZLKAErrorNetwork, LogLevel::Fault, kTask},
  // The cap on request time-outs is one second for this row.
  {"AnswerTooSlow", {{"delay_ms", 5000}, {"remaining", 1}}, {}, ZLKAErrorNetwork, LogLevel::Fault, kTask + "Error Domain=HTTPErrorDomain Code=-1001 "},
  // A session that cannot open: its transport and bad-answer codes keep their meaning, the rest is internal.
  {"SessionTransportFails", {{"endpoint", "setup.crt"}, {"drop", true}}, {}, ZLKAErrorNetwork, LogLevel::Error, kSigning},
  {"SessionAnswerBad", {{"endpoint", "sapSession"}, {"status", 503}}, {}, ZLKAErrorServer, LogLevel::Error, kSigning},
  {"SessionRefusedByThePrimitives", {{"endpoint", "sapSession"}, {"session_info", "AAAA"}}, {}, ZLKAErrorInternal, LogLevel::Error, kSigning},
  // Requests that cannot be built are never sent.
  {"TokenNotDER", nullptr, {.token = Data::fromString("plain text")}, ZLKAErrorInvalidParameter, LogLevel::Info, "[#TokenAuth] tokenArray.count: 0"},
  {"RequestInfoNotJSON", nullptr, {.requestInfo = platform::Dictionary{{"ratio", NAN}}}, ZLKAErrorInternal, LogLevel::Error, "[#TokenAuth] isValidJSONObject (requestDict) = NO!"},
};
// clang-format on

class PipelineTest : public NetworkTest, public ::testing::WithParamInterface<PipelineRow> {
  void TearDown() override {
    platform::HTTPSession::setMaximumTimeout(std::nullopt);
    NetworkTest::TearDown();
  }
};

TEST_P(PipelineTest, FailsWithItsCodeAndLine) {
  json fault = GetParam().fault;
  const bool onTheAnswer = fault.is_object() && !fault.contains("endpoint");
  if (onTheAnswer) fault["endpoint"] = "queryProductPlan";
  if (fault.is_object()) admin().setFault(fault);
  if (fault.contains("delay_ms")) platform::HTTPSession::setMaximumTimeout(std::chrono::milliseconds(1000));
  const Outcome outcome = run(GetParam().call);
  expectFailure(outcome, GetParam().code);
  expectLine(GetParam().level, GetParam().line, outcome.logStart);
  EXPECT_EQ(admin().requests("queryProductPlan"), onTheAnswer ? 1u : 0u);
  // An answer is refused before it is parsed: the handshake's is the only one read.
  EXPECT_LE(log().countStartingWith("[#TokenAuth] responseDict: "), 1) << log().dump();
}

ZLKA_ROWS(PipelineTest, PipelineRow, kRows);

// Signing and verifying wait 10 seconds: a primitive that does not return in time fails the
// request as internal (the wait and the request that gave up on it both log the line), and its
// late result lands nowhere.
class WaitTest : public NetworkTest, public ::testing::WithParamInterface<bool> {};

TEST_P(WaitTest, ASessionThatDoesNotAnswerInTimeIsInternal) {
  const bool verifying = GetParam();
  auto release = std::make_shared<platform::Semaphore>();
  auto hold = [release, used = std::make_shared<std::atomic<bool>>(false)] {
    if (!used->exchange(true)) release->waitFor(std::chrono::seconds(120));
  };
  TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library();
  if (verifying) {
    primitives.verify = [hold, verify = primitives.verify](auto... a) {
      hold();
      return verify(a...);
    };
  } else {
    primitives.sign = [hold, sign = primitives.sign](auto... a) {
      hold();
      return sign(a...);
    };
  }
  installSession(primitives);
  const Outcome outcome = run({.op = Op::activation});
  release->signal();
  expectFailure(outcome, ZLKAErrorInternal);
  const std::string line = std::string("[#TokenAuth] Timed out waiting to ") + (verifying ? "verify" : "generate") +
                           " Tarvex SAP signature!";
  EXPECT_EQ(log().count(LogLevel::Error, line), 2) << log().dump();
  EXPECT_EQ(admin().verified(), verifying ? 1u : 0u);
  EXPECT_FALSE(run({.op = Op::confirmation}).error) << log().dump();
}

INSTANTIATE_TEST_SUITE_P(Primitives, WaitTest, ::testing::Bool(),
                         [](const auto& info) { return std::string(info.param ? "Verify" : "Sign"); });

TEST_F(NetworkTest, SignedRequestsCarryTheFixedHeadersThenTheSessionOnes) {
  const Data signature = Data::fromString(std::string_view("\x00\x01\xfe\xff sig", 8));
  const platform::HTTPRequest request =
      network()->_generateTokenAuthURLRequestForEndpoint("deviceservices/ackAccessory", "ID", signature);
  EXPECT_EQ(request.URL, world().baseURL() + "/deviceservices/ackAccessory");
  EXPECT_EQ(request.HTTPMethod, "POST");
  EXPECT_EQ(request.timeoutInterval, 60.0);
  EXPECT_EQ(request.headerFields,
            (platform::HTTPHeaderFields{{"Content-Type", "application/json"},
                                        {"Accept", "application/json"},
                                        {"protocol-version", "1.0"},
                                        {"session-identifier", "ID"},
                                        {"signature", platform::base64Encode(signature.span())}}));
  EXPECT_EQ(network()->_generateTokenAuthURLRequestForEndpoint("x", std::nullopt, std::nullopt).headerFields.size(),
            3u);
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

}  // namespace
}  // namespace nettest
