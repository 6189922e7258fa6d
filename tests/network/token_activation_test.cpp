// Token activation end to end: the replacement token is the two pieces of the server's answer
// joined, and every way the answer can be refused.
#include <ostream>
#include <string>

#include "network/token_array.h"
#include "network_test_environment.h"
#include "operation_calls.h"
#include "platform/base64.h"
#include "request_body.h"
#include "support/errors.h"

namespace nettest {
namespace {

using nlohmann::json;
using platform::Data;
using platform::LogLevel;

class TokenActivationTest : public NetworkTest {};

TEST_F(TokenActivationTest, ReplacementTokenIsTheTwoPiecesJoined) {
  const ActivationOutcome outcome = requestActivation();
  ASSERT_FALSE(outcome.error) << outcome.error->description() << "\n" << log().dump();
  EXPECT_EQ(outcome.replies, 1);
  ASSERT_TRUE(outcome.newToken);
  // The server's pieces are a DER record naming the accessory and a DER signature of it.
  const auto pieces = parseTokenArray(outcome.newToken);
  ASSERT_TRUE(pieces);
  ASSERT_EQ(pieces->size(), 2u);
  EXPECT_EQ((*pieces)[0].bytes()[0], 0x30);
  EXPECT_NE((*pieces)[0].view().find(kSampleUUID), std::string_view::npos);
  EXPECT_EQ((*pieces)[1].bytes()[0], 0x04);
  EXPECT_EQ((*pieces)[0].length() + (*pieces)[1].length(), outcome.newToken->length());

  // The new token is a token like any other: the server knows its plan, and it can be confirmed.
  const MetadataOutcome plan = requestMetadata(MetadataCall().withToken(outcome.newToken));
  EXPECT_EQ(plan.ppid, "PP-0001-ACCESSORY");
  EXPECT_FALSE(confirmActivation(TokenCall().withToken(outcome.newToken)).error);
  EXPECT_EQ(admin().handshakes(), 1u);
}

TEST_F(TokenActivationTest, BodyHoldsTheTokensAndUUIDOnly) {
  const Data first = sampleToken("one");
  const Data second = derItem(0x04, std::string(200, 'x'));  // a long-form length
  ASSERT_FALSE(requestActivation(TokenCall().withToken(concat({first, second})).withUUID("")).error) << log().dump();
  const auto body = uploadedBody(log());
  ASSERT_TRUE(body);
  EXPECT_EQ(*body, (json{{"tokens", {platform::base64Encode(first.span()), platform::base64Encode(second.span())}},
                         {"uuid", ""}}));
}

TEST_F(TokenActivationTest, MissingOrUnparsableArgumentsFailBeforeSending) {
  expectFailure(requestActivation(TokenCall().withToken(std::nullopt)), ZLKAErrorInvalidParameter);
  expectFailure(requestActivation(TokenCall().withUUID(std::nullopt)), ZLKAErrorInvalidParameter);
  expectFailure(requestActivation(TokenCall().withToken(std::nullopt).withUUID(std::nullopt)),
                ZLKAErrorInvalidParameter);
  expectFailure(requestActivation(TokenCall().withToken(Data())), ZLKAErrorInvalidParameter);
  expectFailure(requestActivation(TokenCall().withToken(Data::fromString("\x04\x09short"))), ZLKAErrorInvalidParameter);
  EXPECT_EQ(admin().requests("activateAccessory"), 0u);
  EXPECT_EQ(admin().handshakes(), 0u);
}

// Answers that the server signs properly but whose pieces are odd.
struct Pieces {
  const char* name;
  std::string body;
  std::vector<uint8_t> token;
};

// Shown by the test runner in place of the bytes of the parameter.
void PrintTo(const Pieces& c, std::ostream* out) { *out << c.name; }

class ActivationPiecesTest : public TokenActivationTest, public ::testing::WithParamInterface<Pieces> {};

TEST_P(ActivationPiecesTest, JoinsWhatDecodes) {
  admin().setFault({{"endpoint", "activateAccessory"}, {"body", GetParam().body}});
  const ActivationOutcome outcome = requestActivation();
  ASSERT_FALSE(outcome.error) << outcome.error->description() << "\n" << log().dump();
  EXPECT_EQ(outcome.replies, 1);
  ASSERT_TRUE(outcome.newToken);
  EXPECT_EQ(outcome.newToken->toVector(), GetParam().token);
}

INSTANTIATE_TEST_SUITE_P(
    Answers, ActivationPiecesTest,
    ::testing::Values(
        Pieces{"three_and_five_bytes", R"({"tokens":["AQID","AQIDBAU="]})", {1, 2, 3, 1, 2, 3, 4, 5}},
        Pieces{"extra_keys_ignored", R"({"status":"ok","tokens":["AQID","BAU="],"count":2})", {1, 2, 3, 4, 5}},
        Pieces{"first_undecodable", R"({"tokens":["not base64!","BAU="]})", {4, 5}},
        Pieces{"second_with_white_space", R"({"tokens":["AQID","BA U="]})", {1, 2, 3}},
        Pieces{"second_without_padding", R"({"tokens":["AQID","BAU"]})", {1, 2, 3}},
        Pieces{"neither_decodes", R"({"tokens":["%%","**"]})", {}},
        Pieces{"empty_pieces", R"({"tokens":["",""]})", {}}),
    [](const ::testing::TestParamInfo<Pieces>& info) { return std::string(info.param.name); });

struct AnswerFault {
  const char* name;
  json fault;
  int64_t code;
  LogLevel level;    // of the line that names the cause
  std::string line;  // its start
};

void PrintTo(const AnswerFault& c, std::ostream* out) { *out << c.name; }

class ActivationAnswerTest : public TokenActivationTest, public ::testing::WithParamInterface<AnswerFault> {};

TEST_P(ActivationAnswerTest, FailsWithItsCode) {
  json fault = GetParam().fault;
  fault["endpoint"] = "activateAccessory";
  admin().setFault(fault);
  const ActivationOutcome outcome = requestActivation();
  expectFailure(outcome, GetParam().code);
  expectLine(GetParam().level, GetParam().line, outcome.logStart);
  EXPECT_EQ(admin().requests("activateAccessory"), 1u);
}

const std::string kStatus = "[#TokenAuth] Server responded with invalid HTTP status code: ";
const std::string kBadDictionary =
    "[#TokenAuth] Invalid response dictionary received from server! (responseDict.count: ";
const std::string kBadArray = "[#TokenAuth] Invalid token array received from server - newTokenArray: ";

INSTANTIATE_TEST_SUITE_P(
    Rows, ActivationAnswerTest,
    ::testing::Values(
        AnswerFault{"status_400", {{"status", 400}}, ZLKAErrorInvalidParameter, LogLevel::Error, kStatus + "400!"},
        AnswerFault{"status_400_empty",
                    {{"status", 400}, {"body", ""}},
                    ZLKAErrorInvalidParameter,
                    LogLevel::Error,
                    kStatus + "400!"},
        AnswerFault{"status_401", {{"status", 401}}, ZLKAErrorInternal, LogLevel::Error, kStatus + "401!"},
        AnswerFault{"status_201", {{"status", 201}}, ZLKAErrorServer, LogLevel::Error, kStatus + "201!"},
        AnswerFault{"status_204", {{"status", 204}}, ZLKAErrorServer, LogLevel::Error, kStatus + "204!"},
        AnswerFault{"status_302", {{"status", 302}}, ZLKAErrorServer, LogLevel::Error, kStatus + "302!"},
        AnswerFault{"status_500", {{"status", 500}}, ZLKAErrorServer, LogLevel::Error, kStatus + "500!"},
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
        AnswerFault{"not_json",
                    {{"body", "tokens: AQID, BAU="}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    "[#TokenAuth] responseJSONError: "},
        AnswerFault{"no_tokens",
                    {{"body", R"({"token":["AQID","BAU="]})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kBadDictionary + "1,"},
        AnswerFault{"tokens_string",
                    {{"body", R"({"tokens":"AQID","uuid":"u"})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kBadDictionary + "2,"},
        AnswerFault{
            "tokens_number", {{"body", R"({"tokens":2})"}}, ZLKAErrorServer, LogLevel::Error, kBadDictionary + "1,"},
        AnswerFault{
            "tokens_null", {{"body", R"({"tokens":null})"}}, ZLKAErrorServer, LogLevel::Error, kBadDictionary + "1,"},
        AnswerFault{"tokens_object",
                    {{"body", R"({"tokens":{"0":"AQID","1":"BAU="}})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kBadDictionary},
        AnswerFault{"top_level_array",
                    {{"body", R"(["AQID","BAU="])"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kBadDictionary + "2,"},
        AnswerFault{"one_piece", {{"body", R"({"tokens":["AQID"]})"}}, ZLKAErrorServer, LogLevel::Error, kBadArray},
        AnswerFault{"three_pieces",
                    {{"body", R"({"tokens":["AQID","BAU=","Bg=="]})"}},
                    ZLKAErrorServer,
                    LogLevel::Error,
                    kBadArray},
        AnswerFault{"no_pieces", {{"body", R"({"tokens":[]})"}}, ZLKAErrorServer, LogLevel::Error, kBadArray},
        AnswerFault{
            "pieces_not_strings", {{"body", R"({"tokens":[1,2]})"}}, ZLKAErrorServer, LogLevel::Error, kBadArray},
        AnswerFault{"dropped",
                    {{"drop", true}, {"remaining", 1}},
                    ZLKAErrorNetwork,
                    LogLevel::Fault,
                    "[#TokenAuth] taskError: "}),
    [](const ::testing::TestParamInfo<AnswerFault>& info) { return std::string(info.param.name); });

TEST_F(TokenActivationTest, TokenArrayLineNamesTheCount) {
  admin().setFault({{"endpoint", "activateAccessory"}, {"body", R"({"tokens":["AQID","BAU=","Bg=="]})"}});
  expectFailure(requestActivation(), ZLKAErrorServer);
  EXPECT_EQ(
      log().count(platform::LogLevel::Error, kBadArray + "[\"AQID\", \"BAU=\", \"Bg==\"], newTokenArray.count: 3!"), 1)
      << log().dump();
}

}  // namespace
}  // namespace nettest
