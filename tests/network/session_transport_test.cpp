// The session's two network legs against the server: the certificate download and the handshake,
// their failure codes, and the time-to-live taken from the handshake answer.
#include <ostream>
#include <string>
#include <vector>

#include "network_test_environment.h"
#include "operation_calls.h"
#include "support/errors.h"

namespace nettest {
namespace {

using nlohmann::json;
using platform::LogLevel;

constexpr char kSettingTTL[] = "[#TarvexSAPSession] Setting TTL... (TTL: ";

class SessionTransportTest : public NetworkTest {
 protected:
  std::optional<platform::Error> open() { return network()->_openTarvexSAPSession(); }
  TarvexSAPSessionState state() { return network()->tarvexSAPSession()->state(); }
  // The TTL the transport set, as logged ("3600.000000"), if it set one.
  std::optional<std::string> loggedTTL() {
    const auto at = log().findStartingWith(kSettingTTL);
    if (!at) return std::nullopt;
    const std::string line = log().entries()[*at].message.substr(sizeof kSettingTTL - 1);
    return line.substr(0, line.find(','));
  }
};

TEST_F(SessionTransportTest, OpensWithTheServersTimeToLive) {
  EXPECT_EQ(open(), std::nullopt) << log().dump();
  EXPECT_EQ(state(), TarvexSAPSessionStateOpen);
  EXPECT_EQ(loggedTTL(), "3600.000000");
  const double ttl = network()->tarvexSAPSession()->TTL();
  EXPECT_GT(ttl, 3000.0);
  EXPECT_LE(ttl, 3600.0);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
  EXPECT_EQ(admin().requests("sapSession"), 1u);
  EXPECT_EQ(admin().handshakes(), 1u);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Opening Tarvex SAP session..."), 1);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Tarvex SAP session opened!"), 1);
  EXPECT_TRUE(log().find(LogLevel::Info, "[#TokenAuth] self._selectedStaticContentServer: " + environment().baseURL()));
  EXPECT_TRUE(log().find(LogLevel::Info, "[#TokenAuth] self._selectedTarvexSAPServer: " + environment().baseURL()));

  // An open session is used as it is.
  EXPECT_EQ(open(), std::nullopt);
  EXPECT_EQ(admin().handshakes(), 1u);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Opening Tarvex SAP session..."), 1);
}

// The handshake request: the two members, both strings, the session's own identifier.
TEST_F(SessionTransportTest, HandshakeRequestCarriesTheSessionIdentifier) {
  ASSERT_EQ(open(), std::nullopt);
  const auto at = log().findStartingWith("[#TokenAuth] requestData (string): ");
  ASSERT_TRUE(at) << log().dump();
  const std::string text =
      log().entries()[*at].message.substr(std::string("[#TokenAuth] requestData (string): ").size());
  const json body = json::parse(text);
  ASSERT_TRUE(body.is_object());
  EXPECT_EQ(body.size(), 2u);
  EXPECT_EQ(body.value("session-identifier", ""), network()->tarvexSAPSession()->UUID().UUIDString());
  ASSERT_TRUE(body["session-request"].is_string());
  EXPECT_EQ(body["session-request"].get<std::string>().find_first_of("\r\n"), std::string::npos);
  const auto headers = log().findStartingWith("[#TokenAuth] request.allHTTPHeaderFields: ");
  ASSERT_TRUE(headers);
  const std::string line = log().entries()[*headers].message;  // the certificate GET has none
  EXPECT_EQ(line, "[#TokenAuth] request.allHTTPHeaderFields: {}");
  const auto post = log().findStartingWith("[#TokenAuth] request.allHTTPHeaderFields: ", *headers + 1);
  ASSERT_TRUE(post);
  EXPECT_EQ(log().entries()[*post].message,
            "[#TokenAuth] request.allHTTPHeaderFields: {\"Accept\": \"application/json\", \"Content-Type\": "
            "\"application/json\", \"protocol-version\": \"1.0\"}");
}

const std::string kStatusLine = "[#TokenAuth] Server responded with invalid HTTP status code: ";
const std::string kEmptyLine = "[#TokenAuth] responseData is empty!";
const std::string kJSONLine = "[#TokenAuth] responseJSONError: ";
const std::string kDictionaryLine =
    "[#TokenAuth] Invalid response dictionary received from server! (responseDict.count: ";
const std::string kTaskLine = "[#TokenAuth] taskError: ";

struct TransportFailure {
  const char* name;
  json fault;
  int64_t code;      // in the session's error domain
  std::string line;  // a line logged at error or fault level, by its start
};

// Shown by the test runner in place of the bytes of the parameter.
void PrintTo(const TransportFailure& c, std::ostream* out) { *out << c.name; }

class TransportFailureTest : public SessionTransportTest, public ::testing::WithParamInterface<TransportFailure> {};

TEST_P(TransportFailureTest, FailsWithItsCodeAndSetsNoTTL) {
  const TransportFailure& c = GetParam();
  admin().setFault(c.fault);
  const std::optional<platform::Error> error = open();
  ASSERT_TRUE(error) << log().dump();
  EXPECT_EQ(error->domain(), TarvexSAPSessionErrorDomain);
  EXPECT_EQ(error->code(), c.code) << error->description();
  if (c.code == TarvexSAPSessionErrorTransport) {
    // The failed task's own details travel with the session's error.
    ASSERT_TRUE(error->userInfo()) << error->description();
    EXPECT_TRUE(error->userInfo()->contains("FailingURL")) << error->description();
  } else {
    EXPECT_FALSE(error->userInfo()) << error->description();
  }
  // The transport logs every cause at error level, a failed task at fault level.
  expectLine(c.line == kTaskLine ? LogLevel::Fault : LogLevel::Error, c.line);
  EXPECT_EQ(loggedTTL(), std::nullopt) << log().dump();
  EXPECT_EQ(state(), TarvexSAPSessionStateClosed);
  EXPECT_TRUE(log().findStartingWith("[#TokenAuth] Couldn't open Tarvex SAP session:\n"));
}

INSTANTIATE_TEST_SUITE_P(
    Rows, TransportFailureTest,
    ::testing::Values(
        TransportFailure{"certificate_500", {{"endpoint", "setup.crt"}, {"status", 500}}, -6, kStatusLine + "500!"},
        TransportFailure{"certificate_404", {{"endpoint", "setup.crt"}, {"status", 404}}, -6, kStatusLine + "404!"},
        TransportFailure{"certificate_204", {{"endpoint", "setup.crt"}, {"status", 204}}, -6, kStatusLine + "204!"},
        TransportFailure{"certificate_empty", {{"endpoint", "setup.crt"}, {"body", ""}}, -6, kEmptyLine},
        TransportFailure{"certificate_dropped", {{"endpoint", "setup.crt"}, {"drop", true}}, -5, kTaskLine},
        TransportFailure{"handshake_500", {{"endpoint", "sapSession"}, {"status", 500}}, -6, kStatusLine + "500!"},
        TransportFailure{"handshake_201", {{"endpoint", "sapSession"}, {"status", 201}}, -6, kStatusLine + "201!"},
        TransportFailure{"handshake_400", {{"endpoint", "sapSession"}, {"status", 400}}, -6, kStatusLine + "400!"},
        TransportFailure{"handshake_empty", {{"endpoint", "sapSession"}, {"body", ""}}, -6, kEmptyLine},
        TransportFailure{"handshake_not_json", {{"endpoint", "sapSession"}, {"body", "session ok"}}, -6, kJSONLine},
        TransportFailure{"handshake_scalar", {{"endpoint", "sapSession"}, {"body", "3600"}}, -6, kJSONLine},
        TransportFailure{"handshake_array",
                         {{"endpoint", "sapSession"}, {"body", R"([{"session-info":"AAAA"}])"}},
                         -6,
                         kDictionaryLine + "1,"},
        TransportFailure{"info_missing",
                         {{"endpoint", "sapSession"}, {"body", R"({"session-validity":3600})"}},
                         -6,
                         kDictionaryLine + "1,"},
        TransportFailure{"validity_missing",
                         {{"endpoint", "sapSession"}, {"body", R"({"session-info":"AAAA"})"}},
                         -6,
                         kDictionaryLine + "1,"},
        TransportFailure{"info_not_a_string",
                         {{"endpoint", "sapSession"}, {"body", R"({"session-info":12,"session-validity":3600})"}},
                         -6,
                         kDictionaryLine + "2,"},
        TransportFailure{
            "validity_as_text", {{"endpoint", "sapSession"}, {"session_validity", "3600"}}, -6, kDictionaryLine + "2,"},
        TransportFailure{
            "validity_null", {{"endpoint", "sapSession"}, {"session_validity", nullptr}}, -6, kDictionaryLine + "2,"},
        TransportFailure{"validity_object",
                         {{"endpoint", "sapSession"}, {"session_validity", json::object()}},
                         -6,
                         kDictionaryLine + "2,"},
        TransportFailure{"handshake_dropped", {{"endpoint", "sapSession"}, {"drop", true}}, -5, kTaskLine},
        TransportFailure{
            "handshake_dropped_once", {{"endpoint", "sapSession"}, {"drop", true}, {"remaining", 1}}, -5, kTaskLine}),
    [](const ::testing::TestParamInfo<TransportFailure>& info) { return std::string(info.param.name); });

struct Validity {
  const char* name;
  json value;
  std::string logged;
};

void PrintTo(const Validity& c, std::ostream* out) { *out << c.name; }

class ValidityTest : public SessionTransportTest, public ::testing::WithParamInterface<Validity> {};

// Any JSON number is a time-to-live in seconds; a Boolean counts as the number 0 or 1.
TEST_P(ValidityTest, SetsTheTTLFromAnyNumber) {
  admin().setFault({{"endpoint", "sapSession"}, {"session_validity", GetParam().value}});
  EXPECT_EQ(open(), std::nullopt) << log().dump();
  EXPECT_EQ(loggedTTL(), GetParam().logged);
  EXPECT_LE(network()->tarvexSAPSession()->TTL(), std::stod(GetParam().logged));
}

INSTANTIATE_TEST_SUITE_P(Numbers, ValidityTest,
                         ::testing::Values(Validity{"true_is_one_second", true, "1.000000"},
                                           Validity{"real", 2.5, "2.500000"}, Validity{"integer", 120, "120.000000"}),
                         [](const ::testing::TestParamInfo<Validity>& info) { return std::string(info.param.name); });

// A validity of zero or less opens the session already expired: its next use closes it, and the
// request after that opens a new one.
TEST_F(SessionTransportTest, ExpiredOnArrivalOpensThenClosesAtNextUse) {
  for (const json& validity : {json(0), json(-5)}) {
    SCOPED_TRACE(validity.dump());
    installSession();
    log().clear();
    admin().setFault({{"endpoint", "sapSession"}, {"session_validity", validity}, {"remaining", 1}});
    const uint64_t before = admin().handshakes();
    EXPECT_EQ(open(), std::nullopt) << log().dump();
    EXPECT_TRUE(loggedTTL());
    EXPECT_EQ(state(), TarvexSAPSessionStateClosed);
    EXPECT_TRUE(log().find(LogLevel::Default, "[#TarvexSAPSession] Session is past expiration, closing session..."));

    MetadataOutcome outcome = requestMetadata();
    EXPECT_FALSE(outcome.error) << log().dump();
    EXPECT_EQ(admin().handshakes(), before + 2);
    EXPECT_EQ(state(), TarvexSAPSessionStateOpen);
  }
}

// Session info that is not base64 still sets the TTL; the session then fails on the missing data.
TEST_F(SessionTransportTest, UndecodableSessionInfoSetsTheTTLThenFails) {
  admin().setFault({{"endpoint", "sapSession"}, {"session_info", "not base64!"}});
  const std::optional<platform::Error> error = open();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), TarvexSAPSessionErrorDomain);
  EXPECT_EQ(error->code(), TarvexSAPSessionErrorInvalidParameter);
  EXPECT_EQ(loggedTTL(), "3600.000000");
  EXPECT_TRUE(log().find(LogLevel::Default, "[#TarvexSAPSession] Invalid handshake response received!"))
      << log().dump();
  EXPECT_EQ(state(), TarvexSAPSessionStateClosed);
}

// Empty session info is data, not nothing: the primitive gets it and refuses it.
TEST_F(SessionTransportTest, EmptySessionInfoReachesThePrimitive) {
  admin().setFault({{"endpoint", "sapSession"}, {"session_info", ""}});
  const std::optional<platform::Error> error = open();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), TarvexSAPSessionErrorInternal);
  EXPECT_TRUE(log().findStartingWith("[#TarvexSAPSession] Could not process handshake response!")) << log().dump();
}

// How a failed open reaches the client of an operation: the session's transport and bad-answer
// codes keep their meaning, anything else becomes internal.
struct OpenFailure {
  const char* name;
  json fault;
  int64_t code;
};

void PrintTo(const OpenFailure& c, std::ostream* out) { *out << c.name; }

class OpenFailureInOperationsTest : public SessionTransportTest, public ::testing::WithParamInterface<OpenFailure> {};

TEST_P(OpenFailureInOperationsTest, MapsTheSessionCode) {
  admin().setFault(GetParam().fault);
  expectFailure(requestMetadata(), GetParam().code);
  EXPECT_TRUE(log().findStartingWith("[#TokenAuth] tarvexError: ")) << log().dump();
  expectFailure(requestActivation(), GetParam().code);
  expectFailure(confirmActivation(), GetParam().code);
  const auto stats = admin().stats();
  for (const char* endpoint : {"queryProductPlan", "activateAccessory", "ackAccessory"})
    EXPECT_EQ(stats["requests"][endpoint].get<uint64_t>(), 0u) << endpoint;
}

INSTANTIATE_TEST_SUITE_P(
    Codes, OpenFailureInOperationsTest,
    ::testing::Values(
        OpenFailure{"transport", {{"endpoint", "setup.crt"}, {"drop", true}}, ZLKAErrorNetwork},
        OpenFailure{"bad_answer", {{"endpoint", "sapSession"}, {"status", 503}}, ZLKAErrorServer},
        OpenFailure{"bad_session_info", {{"endpoint", "sapSession"}, {"session_info", "%%%"}}, ZLKAErrorInternal},
        OpenFailure{"primitive_refuses", {{"endpoint", "sapSession"}, {"session_info", "AAAA"}}, ZLKAErrorInternal}),
    [](const ::testing::TestParamInfo<OpenFailure>& info) { return std::string(info.param.name); });

// A failed open leaves the session closed; the next request opens it afresh.
TEST_F(SessionTransportTest, TheRequestAfterAFailedOpenOpensAgain) {
  admin().setFault({{"endpoint", "setup.crt"}, {"status", 503}, {"remaining", 1}});
  expectFailure(requestActivation(), ZLKAErrorServer);
  ActivationOutcome outcome = requestActivation();
  EXPECT_FALSE(outcome.error) << log().dump();
  EXPECT_EQ(admin().requests("setup.crt"), 2u);
  EXPECT_EQ(admin().handshakes(), 1u);
}

}  // namespace
}  // namespace nettest
