// The pieces of the signed request pipeline on their own: the request builder and the three
// synchronous session wrappers.
#include <atomic>
#include <thread>

#include "network_test_environment.h"
#include "operation_calls.h"
#include "platform/base64.h"
#include "platform/semaphore.h"
#include "support/errors.h"

namespace nettest {
namespace {

using platform::Data;
using platform::LogLevel;

class SignedRequestTest : public NetworkTest {};

TEST_F(SignedRequestTest, RequestCarriesTheFixedHeadersThenTheSessionOnes) {
  const Data signature = Data::fromString("\x00\x01\xfe\xff sig");
  const platform::HTTPRequest request =
      network()->_generateTokenAuthURLRequestForEndpoint("deviceservices/activateAccessory", "SESSION-ID", signature);
  EXPECT_EQ(request.URL, environment().baseURL() + "/deviceservices/activateAccessory");
  EXPECT_EQ(request.HTTPMethod, "POST");
  EXPECT_EQ(request.timeoutInterval, 60.0);
  EXPECT_EQ(request.cachePolicy, 0);
  const platform::HTTPHeaderFields expected = {{"Content-Type", "application/json"},
                                               {"Accept", "application/json"},
                                               {"protocol-version", "1.0"},
                                               {"session-identifier", "SESSION-ID"},
                                               {"signature", platform::base64Encode(signature.span())}};
  EXPECT_EQ(request.headerFields, expected);
}

TEST_F(SignedRequestTest, SessionHeadersOnlyWhenGiven) {
  const platform::HTTPRequest bare =
      network()->_generateTokenAuthURLRequestForEndpoint("deviceservices/ackAccessory", std::nullopt, std::nullopt);
  EXPECT_EQ(bare.headerFields.size(), 3u);
  EXPECT_FALSE(bare.valueForHTTPHeaderField("session-identifier"));
  EXPECT_FALSE(bare.valueForHTTPHeaderField("signature"));
}

TEST_F(SignedRequestTest, SigningOpensTheSessionFirst) {
  bool timedOut = true;
  std::optional<platform::Error> error = platform::Error("stale", 1);
  const std::optional<Data> signature =
      network()->_tarvexSignatureForDataSync(Data::fromString("{}"), &timedOut, &error);
  ASSERT_TRUE(signature) << log().dump();
  EXPECT_FALSE(signature->empty());
  EXPECT_FALSE(timedOut);
  EXPECT_FALSE(error);
  EXPECT_EQ(admin().handshakes(), 1u);
}

// A failed open is the signing's error as it is; nothing is signed and nothing timed out.
TEST_F(SignedRequestTest, SigningReportsAFailedOpen) {
  admin().setFault({{"endpoint", "sapSession"}, {"status", 502}});
  bool timedOut = true;
  std::optional<platform::Error> error;
  const std::optional<Data> signature =
      network()->_tarvexSignatureForDataSync(Data::fromString("{}"), &timedOut, &error);
  EXPECT_FALSE(signature);
  EXPECT_FALSE(timedOut);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), TarvexSAPSessionErrorDomain);
  EXPECT_EQ(error->code(), TarvexSAPSessionErrorBadResponse);
  EXPECT_EQ(log().countStartingWith("[#TarvexSAPSession] Generating signature..."), 0);
}

// Verification never opens the session: on a closed one it fails with the session's own error.
TEST_F(SignedRequestTest, VerificationDoesNotOpen) {
  bool timedOut = true;
  std::optional<platform::Error> error;
  EXPECT_FALSE(
      network()->_verifyTarvexSignatureSync(Data::fromString("sig"), Data::fromString("{}"), &timedOut, &error));
  EXPECT_FALSE(timedOut);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), TarvexSAPSessionErrorInvalidState);
  EXPECT_EQ(admin().requests("setup.crt"), 0u);

  ASSERT_EQ(network()->_openTarvexSAPSession(), std::nullopt);
  EXPECT_FALSE(network()->_verifyTarvexSignatureSync(std::nullopt, Data::fromString("{}"), &timedOut, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), TarvexSAPSessionErrorInvalidParameter);
  // Null out-pointers are allowed.
  EXPECT_FALSE(
      network()->_verifyTarvexSignatureSync(Data::fromString("sig"), Data::fromString("{}"), nullptr, nullptr));
  EXPECT_TRUE(network()->_tarvexSignatureForDataSync(Data::fromString("{}"), nullptr, nullptr));
}

// A session that another request is opening counts as usable: the second caller neither waits
// for it nor opens it again.
TEST_F(SignedRequestTest, ASessionBeingOpenedIsNotOpenedAgain) {
  auto initCalled = std::make_shared<platform::Semaphore>();
  TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library();
  auto init = primitives.init;
  primitives.init = [init, initCalled](QVSAPContextOpaque_** context, TarvexHWInfo_* hwInfo) {
    const int32_t status = init(context, hwInfo);
    initCalled->signal();
    return status;
  };
  installSession(primitives);
  // The certificate takes long enough for the second caller to find the session still opening.
  admin().setFault({{"endpoint", "setup.crt"}, {"delay_ms", 3000}});

  std::optional<platform::Error> openerResult = platform::Error("unset", 0);
  std::thread opener([&] { openerResult = network()->_openTarvexSAPSession(); });
  ASSERT_TRUE(initCalled->waitFor(kReplyGuard));
  EXPECT_EQ(network()->tarvexSAPSession()->state(), TarvexSAPSessionStateInitializing);
  EXPECT_EQ(network()->_openTarvexSAPSession(), std::nullopt);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Tarvex SAP session opened!"), 0) << "the second caller waited";
  opener.join();
  EXPECT_EQ(openerResult, std::nullopt);
  EXPECT_EQ(log().count(LogLevel::Default, "[#TokenAuth] Opening Tarvex SAP session..."), 1);
  EXPECT_EQ(admin().requests("setup.crt"), 1u);
}

}  // namespace
}  // namespace nettest
