// The session's two network legs against the server: the certificate download and the handshake,
// their failures in the session's error domain, and the time-to-live taken from the answer.
#include "common/rows.h"
#include "network_fixture.h"

namespace nettest {
namespace {

const char kOpened[] = "[#TokenAuth] Tarvex SAP session opened!";

TEST_F(NetworkTest, TheSessionOpensOnceWithTheServersTimeToLive) {
  EXPECT_EQ(network()->_openTarvexSAPSession(), std::nullopt) << log().dump();
  EXPECT_EQ(network()->_openTarvexSAPSession(), std::nullopt);  // an open session is used as it is
  EXPECT_EQ(network()->tarvexSAPSession()->state(), TarvexSAPSessionStateOpen);
  expectLine(LogLevel::Debug, "[#TarvexSAPSession] Setting TTL... (TTL: 3600.000000, ");
  EXPECT_GT(network()->tarvexSAPSession()->TTL(), 3000.0);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  EXPECT_EQ(admin().handshakes(), 1u);
  EXPECT_EQ(log().count(LogLevel::Default, kOpened), 1);
  expectLine(LogLevel::Debug,
             "[#TokenAuth] request.allHTTPHeaderFields: {\"Accept\": \"application/json\", \"Content-Type\": "
             "\"application/json\", \"protocol-version\": \"1.0\"}");  // the handshake's
  // The certificate is binary: only the handshake's answer is shown as text.
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] responseData (string): "), 1) << log().dump();
}

struct LegRow {
  const char* name;
  json fault;
  int64_t code;  // in the session's domain
  LogLevel level;
  std::string line;  // its start
};

const std::string kStatus = "[#TokenAuth] Server responded with invalid HTTP status code: ";
const std::string kEmpty = "[#TokenAuth] responseData is empty!";
const std::string kTask = "[#TokenAuth] taskError: ";
const std::string kBadAnswer = "[#TokenAuth] Invalid response dictionary received from server! (responseDict.count: ";

json on(const char* endpoint, json fault) {
  fault["endpoint"] = endpoint;
  return fault;
}
json onCertificate(json fault) { return on("setup.crt", std::move(fault)); }
json onHandshake(json fault) { return on("sapSession", std::move(fault)); }

// clang-format off
const LegRow kLegs[] = {
  {"CertificateStatus", onCertificate({{"status", 404}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kStatus + "404!"},
  {"CertificateEmpty", onCertificate({{"body", ""}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kEmpty},
  {"CertificateDropped", onCertificate({{"drop", true}}), TarvexSAPSessionErrorTransport, LogLevel::Fault, kTask},
  {"HandshakeStatus", onHandshake({{"status", 201}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kStatus + "201!"},
  {"HandshakeEmpty", onHandshake({{"body", ""}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kEmpty},
  {"HandshakeDropped", onHandshake({{"drop", true}}), TarvexSAPSessionErrorTransport, LogLevel::Fault, kTask},
  {"HandshakeNotJSON", onHandshake({{"body", "session ok"}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, "[#TokenAuth] responseJSONError: "},
  {"HandshakeAnArray", onHandshake({{"body", R"([{"session-info":"AAAA"}])"}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kBadAnswer + "1,"},
  {"NoSessionInfo", onHandshake({{"body", R"({"session-validity":3600})"}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kBadAnswer + "1,"},
  {"NoValidity", onHandshake({{"body", R"({"session-info":"AAAA"})"}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kBadAnswer + "1,"},
  {"SessionInfoNotAString", onHandshake({{"body", R"({"session-info":12,"session-validity":3600})"}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kBadAnswer + "2,"},
  {"ValidityAsText", onHandshake({{"session_validity", "3600"}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kBadAnswer + "2,"},
  {"ValidityNull", onHandshake({{"session_validity", nullptr}}), TarvexSAPSessionErrorBadResponse, LogLevel::Error, kBadAnswer + "2,"},
  // Session info that is not base64 reaches the session as no answer at all.
  {"SessionInfoNotBase64", onHandshake({{"session_info", "not base64!"}}), TarvexSAPSessionErrorInvalidParameter, LogLevel::Default, "[#TarvexSAPSession] Invalid handshake response received!"},
  // Empty session info is data: the primitives refuse it.
  {"SessionInfoEmpty", onHandshake({{"session_info", ""}}), TarvexSAPSessionErrorInternal, LogLevel::Error, "[#TarvexSAPSession] Could not process handshake response!"},
};
// clang-format on

class LegTest : public NetworkTest, public ::testing::WithParamInterface<LegRow> {};

TEST_P(LegTest, FailsTheOpenWithItsCode) {
  admin().setFault(GetParam().fault);
  const std::optional<Error> error = network()->_openTarvexSAPSession();
  ASSERT_TRUE(error) << log().dump();
  EXPECT_EQ(error->domain(), TarvexSAPSessionErrorDomain);
  EXPECT_EQ(error->code(), GetParam().code);
  // A failed task's own details travel with the transport error; a bad answer carries none.
  if (error->code() == TarvexSAPSessionErrorTransport) {
    EXPECT_TRUE(error->userInfo().value_or(platform::Dictionary{}).contains("FailingURL")) << error->description();
  } else if (error->code() == TarvexSAPSessionErrorBadResponse) {
    EXPECT_FALSE(error->userInfo()) << error->description();
  }
  expectLine(GetParam().level, GetParam().line);
  expectLine(LogLevel::Error, "[#TokenAuth] Couldn't open Tarvex SAP session:\n");
  EXPECT_EQ(network()->tarvexSAPSession()->state(), TarvexSAPSessionStateClosed);
}

ZLKA_ROWS(LegTest, LegRow, kLegs);

// Any JSON number is a time-to-live in seconds (a Boolean counts as 0 or 1), set before the
// session hears the answer.
TEST_F(NetworkTest, AnyNumberIsATimeToLive) {
  for (const auto& [validity, logged] : {std::pair<json, const char*>{true, "1.000000"}, {2.5, "2.500000"}}) {
    installSession();
    admin().setFault(onHandshake({{"session_validity", validity}}));
    const size_t mark = log().size();
    EXPECT_EQ(network()->_openTarvexSAPSession(), std::nullopt) << log().dump();
    expectLine(LogLevel::Debug, std::string("[#TarvexSAPSession] Setting TTL... (TTL: ") + logged + ", ", mark);
  }
}

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
