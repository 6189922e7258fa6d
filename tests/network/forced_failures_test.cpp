// The forced failures of an internal build, in the order the operations test them: arguments
// first, then the network switch, then the operation's own switch; the secure-association switch
// replaces the signature on the way out and on the way back.
#include <atomic>

#include "network/zlka_network_constants.h"
#include "network_test_environment.h"
#include "operation_calls.h"
#include "request_body.h"
#include "support/errors.h"

namespace nettest {
namespace {

using platform::LogLevel;

constexpr char kNetworkLine[] = "[#TokenAuth] Forcing network failure...";
constexpr char kActivationLine[] = "[#TokenAuth] Forcing token activation failure...";
constexpr char kConfirmationLine[] = "[#TokenAuth] Forcing token confirmation failure...";

class ForcedFailuresTest : public NetworkTest {
 protected:
  // Nothing reached the server, not even the session.
  void expectNothingSent() {
    const auto stats = admin().stats();
    for (const auto& [endpoint, n] : stats["requests"].items()) EXPECT_EQ(n.get<uint64_t>(), 0u) << endpoint;
  }
};

TEST_F(ForcedFailuresTest, NetworkSwitchFailsEveryOperationBeforeAnythingIsSent) {
  suite().set(ZLKAUserDefaultsKey_ForceNetworkFailure, true);
  expectFailure(requestMetadata(), ZLKAErrorNetwork);
  expectFailure(requestActivation(), ZLKAErrorNetwork);
  expectFailure(confirmActivation(), ZLKAErrorNetwork);
  EXPECT_EQ(log().count(LogLevel::Default, kNetworkLine), 3) << log().dump();
  expectNothingSent();
  EXPECT_EQ(network()->tarvexSAPSession()->state(), TarvexSAPSessionStateClosed);
}

TEST_F(ForcedFailuresTest, ArgumentsAreCheckedBeforeTheNetworkSwitch) {
  suite().set(ZLKAUserDefaultsKey_ForceNetworkFailure, true);
  expectFailure(requestMetadata(MetadataCall().withToken(std::nullopt)), ZLKAErrorInvalidParameter);
  expectFailure(requestMetadata(MetadataCall().withLocale("xx_ZZ")), ZLKAErrorInvalidParameter);
  expectFailure(requestActivation(TokenCall().withUUID(std::nullopt)), ZLKAErrorInvalidParameter);
  expectFailure(confirmActivation(TokenCall().withToken(std::nullopt)), ZLKAErrorInvalidParameter);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Invalid locale identifier: xx_ZZ"), 1) << log().dump();
  EXPECT_EQ(log().count(LogLevel::Default, kNetworkLine), 0) << log().dump();
}

TEST_F(ForcedFailuresTest, NetworkSwitchWinsOverTheOperationsOwn) {
  suite().set(ZLKAUserDefaultsKey_ForceNetworkFailure, true);
  suite().set(ZLKAUserDefaultsKey_ForceTokenActivationFailure, true);
  suite().set(ZLKAUserDefaultsKey_ForceTokenConfirmationFailure, true);
  expectFailure(requestActivation(), ZLKAErrorNetwork);
  expectFailure(confirmActivation(), ZLKAErrorNetwork);
  EXPECT_EQ(log().count(LogLevel::Default, kNetworkLine), 2);
  EXPECT_EQ(log().count(LogLevel::Default, kActivationLine), 0);
  EXPECT_EQ(log().count(LogLevel::Default, kConfirmationLine), 0);
}

TEST_F(ForcedFailuresTest, ActivationSwitchFailsActivationAlone) {
  suite().set(ZLKAUserDefaultsKey_ForceTokenActivationFailure, true);
  // Before the token is taken apart: a blob that does not parse still gets the forced failure.
  expectFailure(requestActivation(TokenCall().withToken(platform::Data::fromString("not DER"))), ZLKAErrorNetwork);
  EXPECT_EQ(log().count(LogLevel::Default, kActivationLine), 1) << log().dump();
  expectNothingSent();

  EXPECT_FALSE(confirmActivation().error);
  EXPECT_FALSE(requestMetadata().error);
  EXPECT_EQ(log().count(LogLevel::Default, kActivationLine), 1);
}

TEST_F(ForcedFailuresTest, ConfirmationSwitchFailsConfirmationAlone) {
  suite().set(ZLKAUserDefaultsKey_ForceTokenConfirmationFailure, true);
  expectFailure(confirmActivation(TokenCall().withToken(platform::Data::fromString("not DER"))), ZLKAErrorNetwork);
  EXPECT_EQ(log().count(LogLevel::Default, kConfirmationLine), 1) << log().dump();
  expectNothingSent();

  EXPECT_FALSE(requestActivation().error);
  EXPECT_EQ(log().count(LogLevel::Default, kConfirmationLine), 1);
}

// The request goes out with the four bytes "1234" as its signature and the session's identifier,
// without opening the session; the server refuses it.
TEST_F(ForcedFailuresTest, SAPSwitchSendsTheStandInSignature) {
  suite().set(ZLKAUserDefaultsKey_ForceTarvexSAPFailure, true);
  const std::string uuid = network()->tarvexSAPSession()->UUID().UUIDString();
  expectFailure(requestMetadata(), ZLKAErrorInternal);  // 401
  const auto headers = log().findStartingWith("[#TokenAuth] request.allHTTPHeaderFields: ");
  ASSERT_TRUE(headers) << log().dump();
  const std::string line = log().entries()[*headers].message;
  EXPECT_NE(line.find("\"signature\": \"MTIzNA==\""), std::string::npos) << line;
  EXPECT_NE(line.find("\"session-identifier\": \"" + uuid + "\""), std::string::npos) << line;
  EXPECT_NE(line.find("\"protocol-version\": \"1.0\""), std::string::npos) << line;
  EXPECT_EQ(admin().rejected(), 1u);
  EXPECT_EQ(admin().requests("setup.crt"), 0u);
  EXPECT_EQ(admin().handshakes(), 0u);
  EXPECT_EQ(network()->tarvexSAPSession()->state(), TarvexSAPSessionStateClosed);
}

// An answer that gets past the status check is verified against "1234" and fails.
TEST_F(ForcedFailuresTest, SAPSwitchFailsEveryVerifiedAnswer) {
  suite().set(ZLKAUserDefaultsKey_ForceTarvexSAPFailure, true);
  admin().setFault({{"endpoint", "queryProductPlan"},
                    {"status", 200},
                    {"body", R"({"ppid":"PP-1","locale":"en_US","ppid_metadata":{}})"}});
  admin().setFault({{"endpoint", "activateAccessory"}, {"status", 200}, {"body", R"({"tokens":["AQID","AQID"]})"}});
  expectFailure(requestMetadata(), ZLKAErrorServer);
  expectFailure(requestActivation(), ZLKAErrorServer);
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] tarvexError: "), 2) << log().dump();
  EXPECT_EQ(countParsedAnswers(), 0) << "never parsed";
}

// Confirmation does not verify: its outcome is the status the server gives.
TEST_F(ForcedFailuresTest, SAPSwitchLeavesConfirmationToTheStatus) {
  suite().set(ZLKAUserDefaultsKey_ForceTarvexSAPFailure, true);
  expectFailure(confirmActivation(), ZLKAErrorInternal);  // the server refuses "1234" with 401
  for (int status : {200, 204}) {
    admin().setFault({{"endpoint", "ackAccessory"}, {"status", status}});
    ConfirmationOutcome outcome = confirmActivation();
    EXPECT_FALSE(outcome.error) << status;
    EXPECT_EQ(outcome.replies, 1);
  }
}

// The two sides read the switch separately: turned on while the request is being signed, it
// fails the answer's verification.
TEST_F(ForcedFailuresTest, SAPSwitchIsReadAgainForTheAnswer) {
  TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library();
  auto realSign = primitives.sign;
  auto flipped = std::make_shared<std::atomic<bool>>(false);
  primitives.sign = [realSign, flipped](QVSAPContextOpaque_* context, const uint8_t* data, size_t length,
                                        uint8_t** signature, uint32_t* signatureLength) {
    if (!flipped->exchange(true)) environment().suite().set(ZLKAUserDefaultsKey_ForceTarvexSAPFailure, true);
    return realSign(context, data, length, signature, signatureLength);
  };
  installSession(primitives);
  expectFailure(requestActivation(), ZLKAErrorServer);
  EXPECT_EQ(admin().verified(), 1u) << "the request itself carried a real signature";
  EXPECT_TRUE(flipped->load());
}

}  // namespace
}  // namespace nettest
