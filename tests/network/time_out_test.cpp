// The waits that end by themselves: signing and verification give up after their fixed 10
// seconds (each tested once, with a primitive that does not return until released), and HTTP
// requests after their time-out, capped here at one second.
#include <atomic>
#include <chrono>
#include <memory>

#include "network_test_environment.h"
#include "operation_calls.h"
#include "platform/http_session.h"
#include "platform/semaphore.h"
#include "support/errors.h"

namespace nettest {
namespace {

using platform::LogLevel;

// Holds the first call of a primitive until released (or until the guard runs out).
struct Gate {
  std::atomic<bool> used{false};
  platform::Semaphore release;

  bool holdsThisCall() { return !used.exchange(true); }
  void hold() { release.waitFor(std::chrono::seconds(120)); }
};

class TimeOutTest : public NetworkTest {
 protected:
  void SetUp() override {
    NetworkTest::SetUp();
    platform::HTTPSession::setMaximumTimeout(std::chrono::milliseconds(1000));
  }
  void TearDown() override {
    if (gate_) gate_->release.signal();
    platform::HTTPSession::setMaximumTimeout(std::nullopt);
    NetworkTest::TearDown();
  }

  std::shared_ptr<Gate> gate_ = std::make_shared<Gate>();
};

TEST_F(TimeOutTest, SigningThatNeverFinishesFailsAfterItsWait) {
  TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library();
  auto sign = primitives.sign;
  primitives.sign = [sign, gate = gate_](QVSAPContextOpaque_* context, const uint8_t* data, size_t length,
                                         uint8_t** signature, uint32_t* signatureLength) {
    if (gate->holdsThisCall()) gate->hold();
    return sign(context, data, length, signature, signatureLength);
  };
  installSession(primitives);

  const MetadataOutcome outcome = requestMetadata();
  expectFailure(outcome, ZLKAErrorInternal);
  // Once by the wait, once by the request that gave up on it.
  EXPECT_EQ(log().count(LogLevel::Error, "[#TokenAuth] Timed out waiting to generate Tarvex SAP signature!"), 2)
      << log().dump();
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] tarvexError: "), 0);
  EXPECT_EQ(admin().requests("queryProductPlan"), 0u);

  // The late signature lands nowhere; the session goes on serving.
  gate_->release.signal();
  const ActivationOutcome next = requestActivation();
  EXPECT_FALSE(next.error) << log().dump();
  EXPECT_EQ(outcome.replies, 1);
}

TEST_F(TimeOutTest, VerificationThatNeverFinishesFailsAfterItsWait) {
  TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library();
  auto verify = primitives.verify;
  primitives.verify = [verify, gate = gate_](QVSAPContextOpaque_* context, const uint8_t* signature,
                                             size_t signatureLength, uint8_t* data, size_t length) {
    if (gate->holdsThisCall()) gate->hold();
    return verify(context, signature, signatureLength, data, length);
  };
  installSession(primitives);

  const ActivationOutcome outcome = requestActivation();
  expectFailure(outcome, ZLKAErrorInternal);
  EXPECT_EQ(log().count(LogLevel::Error, "[#TokenAuth] Timed out waiting to verify Tarvex SAP signature!"), 2)
      << log().dump();
  EXPECT_EQ(log().countStartingWith("[#TokenAuth] responseDict: {\"tokens\""), 0) << "never parsed";
  EXPECT_EQ(admin().verified(), 1u);

  gate_->release.signal();
  const MetadataOutcome next = requestMetadata();
  EXPECT_FALSE(next.error) << log().dump();
}

// An answer slower than the request's time-out is a transport failure, for the operations and
// for both legs of the session.
TEST_F(TimeOutTest, SlowAnswersAreTransportFailures) {
  struct Case {
    const char* endpoint;
    int64_t code;
  };
  for (const Case c : {Case{"queryProductPlan", ZLKAErrorNetwork}, Case{"setup.crt", ZLKAErrorNetwork},
                       Case{"sapSession", ZLKAErrorNetwork}}) {
    SCOPED_TRACE(c.endpoint);
    installSession();
    admin().setFault({{"endpoint", c.endpoint}, {"delay_ms", 5000}, {"remaining", 1}});
    const MetadataOutcome outcome = requestMetadata();
    expectFailure(outcome, c.code);
    const auto task =
        log().findStartingWith("[#TokenAuth] taskError: Error Domain=HTTPErrorDomain Code=-1001 ", outcome.logStart);
    ASSERT_TRUE(task) << log().dump();
    EXPECT_EQ(log().entries()[*task].level, LogLevel::Fault);
  }
}

}  // namespace
}  // namespace nettest
