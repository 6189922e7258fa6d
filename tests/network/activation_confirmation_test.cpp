// Activation confirmation end to end: the answer is judged by its status alone.
#include <ostream>
#include <string>

#include "network_test_environment.h"
#include "operation_calls.h"
#include "request_body.h"
#include "support/errors.h"

namespace nettest {
namespace {

using nlohmann::json;
using platform::Data;

class ActivationConfirmationTest : public NetworkTest {};

TEST_F(ActivationConfirmationTest, ServersNoContentAnswerIsSuccess) {
  const ConfirmationOutcome outcome = confirmActivation();
  EXPECT_FALSE(outcome.error) << outcome.error->description() << "\n" << log().dump();
  EXPECT_EQ(outcome.replies, 1);
  EXPECT_EQ(admin().verified(), 1u);
  EXPECT_EQ(admin().stats()["statuses"].value("204", uint64_t{0}), 1u);
  // Nothing of the answer is verified or read.
  EXPECT_EQ(log().countStartingWith("[#TarvexSAPSession] Verifying signature..."), 0) << log().dump();
  EXPECT_EQ(countParsedAnswers(), 0);
  const auto body = uploadedBody(log());
  ASSERT_TRUE(body);
  EXPECT_EQ(body->size(), 2u);
  EXPECT_TRUE(body->contains("tokens"));
  EXPECT_EQ((*body)["uuid"], kSampleUUID);
}

// Whatever the body or signature, 200 and 204 are success.
TEST_F(ActivationConfirmationTest, SuccessStatusesIgnoreBodyAndSignature) {
  const std::vector<json> faults = {
      {{"status", 200}},
      {{"status", 200}, {"body", ""}},
      {{"status", 200}, {"body", "not json at all"}},
      {{"status", 200}, {"signature", "missing"}},
      {{"status", 200}, {"signature", "corrupt"}},
      {{"status", 204}, {"signature", "missing"}},
      {{"signature", "corrupt"}},
  };
  for (json fault : faults) {
    fault["endpoint"] = "ackAccessory";
    admin().setFault(fault);
    const ConfirmationOutcome outcome = confirmActivation();
    EXPECT_FALSE(outcome.error) << fault.dump() << "\n" << log().dump();
    EXPECT_EQ(outcome.replies, 1);
  }
}

TEST_F(ActivationConfirmationTest, MissingOrUnparsableArgumentsFailBeforeSending) {
  expectFailure(confirmActivation(TokenCall().withToken(std::nullopt)), ZLKAErrorInvalidParameter);
  expectFailure(confirmActivation(TokenCall().withUUID(std::nullopt)), ZLKAErrorInvalidParameter);
  expectFailure(confirmActivation(TokenCall().withToken(Data::fromString("\x04\x09short"))), ZLKAErrorInvalidParameter);
  EXPECT_EQ(admin().requests("ackAccessory"), 0u);
  EXPECT_EQ(admin().handshakes(), 0u);
}

struct StatusFault {
  const char* name;
  json fault;
  int64_t code;
  std::string line;
};

// Shown by the test runner in place of the bytes of the parameter.
void PrintTo(const StatusFault& c, std::ostream* out) { *out << c.name; }

class ConfirmationStatusTest : public ActivationConfirmationTest, public ::testing::WithParamInterface<StatusFault> {};

TEST_P(ConfirmationStatusTest, FailsWithItsCode) {
  json fault = GetParam().fault;
  fault["endpoint"] = "ackAccessory";
  admin().setFault(fault);
  const ConfirmationOutcome outcome = confirmActivation();
  expectFailure(outcome, GetParam().code);
  expectLine(
      GetParam().line.find("taskError") != std::string::npos ? platform::LogLevel::Fault : platform::LogLevel::Error,
      GetParam().line, outcome.logStart);
  EXPECT_EQ(admin().requests("ackAccessory"), 1u);
}

const std::string kStatus = "[#TokenAuth] Server responded with invalid HTTP status code: ";

INSTANTIATE_TEST_SUITE_P(
    Rows, ConfirmationStatusTest,
    ::testing::Values(
        StatusFault{"status_201", {{"status", 201}}, ZLKAErrorServer, kStatus + "201!\nresponseData (string): "},
        StatusFault{"status_400",
                    {{"status", 400}, {"body", R"({"error":"bad"})"}},
                    ZLKAErrorInvalidParameter,
                    kStatus + "400!\nresponseData (string): {\"error\":\"bad\"}"},
        StatusFault{"status_401", {{"status", 401}}, ZLKAErrorInternal, kStatus + "401!"},
        StatusFault{"status_302", {{"status", 302}}, ZLKAErrorServer, kStatus + "302!"},
        StatusFault{"status_404", {{"status", 404}}, ZLKAErrorServer, kStatus + "404!"},
        StatusFault{"status_500", {{"status", 500}}, ZLKAErrorServer, kStatus + "500!"},
        StatusFault{"dropped", {{"drop", true}, {"remaining", 1}}, ZLKAErrorNetwork, "[#TokenAuth] taskError: "}),
    [](const ::testing::TestParamInfo<StatusFault>& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace nettest
