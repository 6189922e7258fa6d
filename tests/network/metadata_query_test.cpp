// The product-plan metadata query end to end: arguments and locales, the request body, the
// server's answer, and every way the answer can be refused.
#include <cmath>
#include <limits>
#include <ostream>
#include <string>

#include "network_test_environment.h"
#include "operation_calls.h"
#include "platform/base64.h"
#include "platform/locale.h"
#include "request_body.h"
#include "support/errors.h"

namespace nettest {
namespace {

using nlohmann::json;
using platform::Dictionary;
using platform::Locale;
using platform::LogLevel;
using platform::Value;

class MetadataQueryTest : public NetworkTest {
 protected:
  void expectNoTokenRequest() {
    EXPECT_EQ(admin().requests("queryProductPlan"), 0u);
    EXPECT_EQ(admin().handshakes(), 0u);
  }
};

TEST_F(MetadataQueryTest, AnswersWithTheServersLocale) {
  struct Case {
    const char* requested;
    const char* answered;
  };
  // In the catalogue; only its language in the catalogue; the default locale's language.
  for (const Case c :
       {Case{"de_DE", "de_DE"}, Case{"fr_CA", "fr_FR"}, Case{"en_AU", "en_US"}, Case{"ja_JP", "ja_JP"}}) {
    SCOPED_TRACE(c.requested);
    ASSERT_TRUE(platform::isAvailableLocaleIdentifier(c.requested));
    MetadataOutcome outcome = requestMetadata(MetadataCall().withLocale(c.requested));
    ASSERT_FALSE(outcome.error) << outcome.error->description() << "\n" << log().dump();
    EXPECT_EQ(outcome.replies, 1);
    EXPECT_EQ(outcome.ppid, "PP-0001-ACCESSORY");
    EXPECT_EQ(outcome.locale, Locale(c.answered));
    ASSERT_TRUE(outcome.metadata);
    EXPECT_EQ(outcome.metadata->count("model"), 1u);
  }
  const MetadataOutcome german = requestMetadata(MetadataCall().withLocale("de_DE"));
  ASSERT_TRUE(german.metadata);
  EXPECT_EQ(german.metadata->at("name"), Value("Zubehör-Dock"));
  EXPECT_EQ(admin().handshakes(), 1u);
  EXPECT_EQ(admin().verified(), 5u);
}

TEST_F(MetadataQueryTest, BodyHoldsTheTokensUUIDAndLocale) {
  const platform::Data first = sampleToken("first");
  const platform::Data second = derItem(0x04, "second item");
  const platform::Data third = derItem(0x02, "\x01");
  ASSERT_FALSE(requestMetadata(MetadataCall().withToken(concat({first, second, third})).withLocale("fr_FR")).error);
  const auto body = uploadedBody(log());
  ASSERT_TRUE(body) << log().dump();
  EXPECT_EQ(*body, (json{{"tokens",
                          {platform::base64Encode(first.span()), platform::base64Encode(second.span()),
                           platform::base64Encode(third.span())}},
                         {"uuid", kSampleUUID},
                         {"locale", "fr_FR"}}));
}

TEST_F(MetadataQueryTest, RequestInfoTravelsAsItIs) {
  Dictionary info{{"serial", "A1B2"},
                  {"retries", 3},
                  {"flags", platform::Array{Value(true), Value(platform::Null{})}},
                  {"nested", Dictionary{{"ratio", 0.5}}}};
  const size_t start = log().size();
  ASSERT_FALSE(requestMetadata(MetadataCall().withRequestInfo(info)).error) << log().dump();
  const auto body = uploadedBody(log(), start);
  ASSERT_TRUE(body);
  EXPECT_EQ(body->size(), 4u);
  EXPECT_EQ((*body)["request_info"],
            (json{{"serial", "A1B2"}, {"retries", 3}, {"flags", {true, nullptr}}, {"nested", {{"ratio", 0.5}}}}));

  const size_t again = log().size();
  ASSERT_FALSE(requestMetadata(MetadataCall().withRequestInfo(Dictionary{})).error);
  EXPECT_EQ((*uploadedBody(log(), again))["request_info"], json::object());
}

TEST_F(MetadataQueryTest, RequestInfoThatIsNotJSONFailsBeforeSending) {
  for (const Value& bad : {Value(platform::Data::fromString("raw")), Value(std::numeric_limits<double>::quiet_NaN()),
                           Value(std::numeric_limits<double>::infinity()), Value(platform::Opaque{"fd"})}) {
    SCOPED_TRACE(bad.typeName());
    expectFailure(requestMetadata(MetadataCall().withRequestInfo(Dictionary{{"value", bad}})), ZLKAErrorInternal);
  }
  EXPECT_EQ(log().count(LogLevel::Error, "[#TokenAuth] isValidJSONObject (requestDict) = NO!"), 4) << log().dump();
  expectNoTokenRequest();
}

TEST_F(MetadataQueryTest, MissingArgumentsAreInvalid) {
  expectFailure(requestMetadata(MetadataCall().withToken(std::nullopt)), ZLKAErrorInvalidParameter);
  expectFailure(requestMetadata(MetadataCall().withUUID(std::nullopt)), ZLKAErrorInvalidParameter);
  expectFailure(requestMetadata(MetadataCall().withLocale(std::nullopt)), ZLKAErrorInvalidParameter);
  expectNoTokenRequest();
  // An empty uuid is an argument like any other.
  EXPECT_FALSE(requestMetadata(MetadataCall().withUUID("")).error);
  EXPECT_EQ((*uploadedBody(log()))["uuid"], "");
}

TEST_F(MetadataQueryTest, UnknownRequestedLocaleFailsBeforeSending) {
  for (const char* identifier : {"xx_ZZ", "en-US", "", "EN_us"}) {
    SCOPED_TRACE(identifier);
    const size_t start = log().size();
    expectFailure(requestMetadata(MetadataCall().withLocale(identifier)), ZLKAErrorInvalidParameter);
    EXPECT_TRUE(
        log().find(LogLevel::Default, std::string("[#TokenAuth] Invalid locale identifier: ") + identifier, start));
  }
  expectNoTokenRequest();
}

TEST_F(MetadataQueryTest, TokenDataThatIsNotDERFailsBeforeSending) {
  for (const platform::Data& token : {platform::Data(),
                                      platform::Data::fromString("\x30\x05"
                                                                 "ab"),
                                      platform::Data::fromString("plain text")}) {
    expectFailure(requestMetadata(MetadataCall().withToken(token)), ZLKAErrorInvalidParameter);
  }
  expectNoTokenRequest();
}

// Each way the answer can go wrong, with the fault that makes the server answer so.
struct AnswerFault {
  const char* name;
  json fault;
  int64_t code;
  LogLevel level;    // of the line that names the cause
  std::string line;  // its start
};

// Shown by the test runner in place of the bytes of the parameter.
void PrintTo(const AnswerFault& c, std::ostream* out) { *out << c.name; }

class MetadataAnswerTest : public MetadataQueryTest, public ::testing::WithParamInterface<AnswerFault> {};

TEST_P(MetadataAnswerTest, FailsWithItsCode) {
  json fault = GetParam().fault;
  fault["endpoint"] = "queryProductPlan";
  admin().setFault(fault);
  const MetadataOutcome outcome = requestMetadata();
  expectFailure(outcome, GetParam().code);
  expectLine(GetParam().level, GetParam().line, outcome.logStart);
  EXPECT_EQ(admin().requests("queryProductPlan"), 1u);
}

const std::string kStatus = "[#TokenAuth] Server responded with invalid HTTP status code: ";
const std::string kInvalidJSON = "[#TokenAuth] Invalid JSON response received from server! ";
const std::string kInvalidLocale = "[#TokenAuth] Invalid locale received from server: ";

INSTANTIATE_TEST_SUITE_P(
    Rows, MetadataAnswerTest,
    ::testing::Values(
        AnswerFault{"status_400",
                    {{"status", 400}},
                    ZLKAErrorInvalidParameter,
                    LogLevel::Error,
                    kStatus + "400!\nresponseData (string): {"},
        AnswerFault{"status_400_empty",
                    {{"status", 400}, {"body", ""}},
                    ZLKAErrorInvalidParameter,
                    LogLevel::Error,
                    kStatus + "400!\nresponseData (string): "},
        AnswerFault{"status_401", {{"status", 401}}, ZLKAErrorInternal, LogLevel::Error, kStatus + "401!"},
        AnswerFault{"status_201", {{"status", 201}}, ZLKAErrorServer, LogLevel::Error, kStatus + "201!"},
        AnswerFault{"status_204", {{"status", 204}}, ZLKAErrorServer, LogLevel::Error, kStatus + "204!"},
        AnswerFault{"status_302", {{"status", 302}}, ZLKAErrorServer, LogLevel::Error, kStatus + "302!"},
        AnswerFault{"status_500",
                    {{"status", 500}, {"body", R"({"error":"down"})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kStatus + "500!\nresponseData (string): {\"error\":\"down\"}"},
        AnswerFault{
            "empty_body", {{"body", ""}}, ZLKAErrorServer, LogLevel::Default, "[#TokenAuth] responseData is empty!"},
        AnswerFault{"signature_missing",
                    {{"signature", "missing"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    "[#TokenAuth] tarvexError: "},
        AnswerFault{"signature_corrupt",
                    {{"signature", "corrupt"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    "[#TokenAuth] tarvexError: "},
        AnswerFault{
            "not_json", {{"body", "ppid=PP-1"}}, ZLKAErrorServer, LogLevel::Error, "[#TokenAuth] responseJSONError: "},
        AnswerFault{"json_scalar",
                    {{"body", "\"PP-1\""}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    "[#TokenAuth] responseJSONError: "},
        AnswerFault{
            "top_level_array", {{"body", R"(["PP-1","en_US",{}])"}}, ZLKAErrorServer, LogLevel::Error, kInvalidJSON},
        AnswerFault{"no_ppid",
                    {{"body", R"({"locale":"en_US","ppid_metadata":{}})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kInvalidJSON},
        AnswerFault{"no_locale",
                    {{"body", R"({"ppid":"PP-1","ppid_metadata":{}})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kInvalidJSON},
        AnswerFault{"no_metadata",
                    {{"body", R"({"ppid":"PP-1","locale":"en_US"})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kInvalidJSON},
        AnswerFault{"ppid_not_a_string",
                    {{"body", R"({"ppid":7,"locale":"en_US","ppid_metadata":{}})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kInvalidJSON},
        AnswerFault{"metadata_not_an_object",
                    {{"body", R"({"ppid":"PP-1","locale":"en_US","ppid_metadata":"x"})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kInvalidJSON},
        AnswerFault{"locale_unknown",
                    {{"body", R"({"ppid":"PP-1","locale":"xx_ZZ","ppid_metadata":{}})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kInvalidLocale + "'xx_ZZ'"},
        AnswerFault{"locale_other_form",
                    {{"body", R"({"ppid":"PP-1","locale":"en-US","ppid_metadata":{}})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kInvalidLocale + "'en-US'"},
        AnswerFault{"locale_number",
                    {{"body", R"({"ppid":"PP-1","locale":42,"ppid_metadata":{}})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kInvalidLocale},
        AnswerFault{"locale_null",
                    {{"body", R"({"ppid":"PP-1","locale":null,"ppid_metadata":{}})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kInvalidLocale},
        AnswerFault{"dropped",
                    {{"drop", true}, {"remaining", 1}},
                    ZLKAErrorNetwork,
                    LogLevel::Fault,
                    "[#TokenAuth] taskError: "}),
    [](const ::testing::TestParamInfo<AnswerFault>& info) { return std::string(info.param.name); });

TEST_F(MetadataQueryTest, AnswerMayNameAnotherKnownLocaleAndCarryExtraKeys) {
  admin().setFault({{"endpoint", "queryProductPlan"},
                    {"body", R"({"ppid":"PP-9","locale":"es_ES","ppid_metadata":{"name":"Base"},"extra":[1,2]})"}});
  const MetadataOutcome outcome = requestMetadata(MetadataCall().withLocale("de_DE"));
  ASSERT_FALSE(outcome.error) << log().dump();
  EXPECT_EQ(outcome.ppid, "PP-9");
  EXPECT_EQ(outcome.locale, Locale("es_ES"));
  EXPECT_EQ(outcome.metadata, (Dictionary{{"name", "Base"}}));
}

// A response is refused before it is parsed: a status or signature failure logs no parsed answer.
TEST_F(MetadataQueryTest, RefusedAnswersAreNeverParsed) {
  for (const json& fault : {json{{"endpoint", "queryProductPlan"}, {"status", 500}},
                            json{{"endpoint", "queryProductPlan"}, {"signature", "missing"}}}) {
    admin().setFault(fault);
    expectFailure(requestMetadata(), ZLKAErrorServer);
  }
  EXPECT_EQ(countParsedAnswers(), 0) << log().dump();
}

}  // namespace
}  // namespace nettest
