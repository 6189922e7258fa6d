// Signing request bodies and verifying answers through the session, against the scripted layer.
#include <gtest/gtest.h>

#include "sap_test_support.h"

namespace saptest {
namespace {

using platform::LogLevel;
using platform::Value;

class SessionSignTest : public SessionTest {};

TEST_F(SessionSignTest, SignsWithTheOpenContextAndHandsOverTheBufferItself) {
  openOrFail();
  auto done = std::make_shared<SignRecorder>();
  session_->signatureForData(dataOf("body"), done->handler());
  ASSERT_TRUE(done->wait());
  flush();
  EXPECT_EQ(done->calls(), 1);
  EXPECT_EQ(done->queue(), session_->completionQueue().get());
  const auto [signature, error] = done->result();
  EXPECT_FALSE(error.has_value());
  ASSERT_TRUE(signature.has_value());
  EXPECT_EQ(textOf(*signature), "SIG(body)");

  const auto signs = layer_->signs();
  ASSERT_EQ(signs.size(), 1u);
  EXPECT_EQ(signs[0].context, layer_->handles().at(0));
  EXPECT_EQ(signs[0].data, "body");
  EXPECT_TRUE(signs[0].presetsUntouched) << "outputs must start null and 0";
  EXPECT_EQ(signature->bytes(), signs[0].outBuffer) << "the signature must wrap the layer's buffer, not a copy";
  EXPECT_EQ(log_->count(LogLevel::Info, "[#TarvexSAPSession] Generating signature..."), 1);
}

TEST_F(SessionSignTest, EmptyBodyIsSigned) {
  openOrFail();
  const auto [signature, error] = sign(Value(Data()));
  EXPECT_FALSE(error.has_value());
  ASSERT_TRUE(signature.has_value());
  EXPECT_EQ(textOf(*signature), "SIG()");
}

TEST_F(SessionSignTest, AnythingButBytesIsInvalidParameterWhetherOpenOrNot) {
  for (bool open : {false, true}) {
    SCOPED_TRACE(open ? "open" : "closed");
    if (open) openOrFail();
    log_->clear();
    {
      const auto [signature, error] = sign(Value("a string"));
      EXPECT_FALSE(signature.has_value());
      expectSessionError(error, -3, "An invalid parameter was provided by the caller.");
      EXPECT_EQ(log_->count(LogLevel::Info,
                            "[#TarvexSAPSession] Invalid parameter! (data.class: String, data: \"a string\")"),
                1)
          << ::testing::PrintToString(log_->lines());
    }
    {
      const auto [signature, error] = sign(std::nullopt);
      EXPECT_FALSE(signature.has_value());
      expectSessionError(error, -3, "An invalid parameter was provided by the caller.");
      EXPECT_EQ(log_->count(LogLevel::Info, "[#TarvexSAPSession] Invalid parameter! (data.class: (null), data: (null))"), 1)
          << ::testing::PrintToString(log_->lines());
    }
    EXPECT_TRUE(layer_->signs().empty());
  }
}

TEST_F(SessionSignTest, ClosedSessionCannotSign) {
  const auto [signature, error] = sign(Value(dataOf("body")));
  EXPECT_FALSE(signature.has_value());
  expectSessionError(error, -7, "Session must be open to generate signature.");
  EXPECT_TRUE(layer_->signs().empty());

  openOrFail();
  session_->close();
  const auto [again, againError] = sign(Value(dataOf("body")));
  EXPECT_FALSE(again.has_value());
  expectSessionError(againError, -7, "Session must be open to generate signature.");
  EXPECT_TRUE(layer_->signs().empty());
}

TEST_F(SessionSignTest, OpeningSessionCannotSign) {
  delegate_->certificate.hold();
  session_->openWithCompletionHandler(nullptr);
  ASSERT_TRUE(delegate_->certificate.waitHeld());
  const auto [signature, error] = sign(Value(dataOf("body")));
  EXPECT_FALSE(signature.has_value());
  expectSessionError(error, -7, "Session must be open to generate signature.");
  EXPECT_EQ(stateInt(), 2u);
  EXPECT_TRUE(layer_->teardowns().empty());
}

TEST_F(SessionSignTest, PrimitiveFailureIsInvalidParameterAndTheSessionStaysOpen) {
  openOrFail();
  layer_->signStatus = -6;
  for (bool bufferReturned : {true, false}) {
    SCOPED_TRACE(bufferReturned ? "with a buffer" : "without a buffer");
    layer_->signReturnsBufferOnFailure = bufferReturned;
    log_->clear();
    const auto [signature, error] = sign(Value(dataOf("body")));
    EXPECT_FALSE(signature.has_value());
    expectSessionError(error, -3, "An invalid parameter was provided by the caller.");
    EXPECT_EQ(log_->count(LogLevel::Error, "[#TarvexSAPSession] Could not generate signature! (status: -6)"), 1);
    EXPECT_EQ(stateInt(), 6u);
  }
  EXPECT_TRUE(layer_->teardowns().empty());
}

TEST_F(SessionSignTest, AnEmptyCompletionDoesNothingAtAll) {
  openOrFail();
  session_->setTTL(-1);  // anything that ran would close the session
  log_->clear();
  session_->signatureForData(dataOf("body"), nullptr);
  session_->signatureForData(std::optional<Value>(Value("not bytes")), nullptr);
  flush();
  EXPECT_TRUE(layer_->signs().empty());
  EXPECT_TRUE(layer_->teardowns().empty());
  EXPECT_EQ(stateInt(), 6u);
  EXPECT_TRUE(log_->lines().empty()) << ::testing::PrintToString(log_->lines());
}

class SessionVerifyTest : public SessionTest {
 protected:
  std::pair<bool, std::optional<Error>> verifyData(const std::optional<Data>& signature, const Data& data) {
    auto done = std::make_shared<VerifyRecorder>();
    session_->verifySignature(signature, data, done->handler());
    if (!done->wait()) {
      ADD_FAILURE() << "verification never completed";
      return {false, std::nullopt};
    }
    flush();
    EXPECT_EQ(done->calls(), 1);
    EXPECT_EQ(done->queue(), session_->completionQueue().get());
    auto [valid, error] = done->result();
    return {valid, error};
  }
};

TEST_F(SessionVerifyTest, AcceptsAValidSignature) {
  openOrFail();
  const auto [valid, error] = verifyData(dataOf("RSP(answer)"), dataOf("answer"));
  EXPECT_TRUE(valid);
  EXPECT_FALSE(error.has_value());
  const auto verifies = layer_->verifies();
  ASSERT_EQ(verifies.size(), 1u);
  EXPECT_EQ(verifies[0].context, layer_->handles().at(0));
  EXPECT_EQ(verifies[0].signature, "RSP(answer)");
  EXPECT_EQ(verifies[0].data, "answer");
  EXPECT_EQ(log_->count(LogLevel::Info, "[#TarvexSAPSession] Verifying signature..."), 1);
}

TEST_F(SessionVerifyTest, RejectedSignatureIsInvalidParameterAndTheSessionStaysOpen) {
  openOrFail();
  const auto [valid, error] = verifyData(dataOf("RSP(other)"), dataOf("answer"));
  EXPECT_FALSE(valid);
  expectSessionError(error, -3, "An invalid parameter was provided by the caller.");
  EXPECT_EQ(log_->count(LogLevel::Default, "[#TarvexSAPSession] Signature verification failed! (status: -6)"), 1);
  EXPECT_EQ(stateInt(), 6u);
  EXPECT_TRUE(layer_->teardowns().empty());
  // Still usable.
  EXPECT_TRUE(verifyData(dataOf("RSP(answer)"), dataOf("answer")).first);
}

TEST_F(SessionVerifyTest, AnyNonZeroStatusIsAFailure) {
  openOrFail();
  layer_->verifyStatus = 3;
  const auto [valid, error] = verifyData(dataOf("RSP(answer)"), dataOf("answer"));
  EXPECT_FALSE(valid);
  expectSessionError(error, -3, "An invalid parameter was provided by the caller.");
  EXPECT_EQ(log_->count(LogLevel::Default, "[#TarvexSAPSession] Signature verification failed! (status: 3)"), 1);
}

TEST_F(SessionVerifyTest, ThePrimitiveGetsAPrivateWritableCopy) {
  openOrFail();
  layer_->verifyScribbles = true;
  const Data caller = dataOf("answer");
  const auto [valid, error] = verifyData(dataOf("RSP(answer)"), caller);
  EXPECT_TRUE(valid);
  EXPECT_EQ(textOf(caller), "answer");
  const auto verifies = layer_->verifies();
  ASSERT_EQ(verifies.size(), 1u);
  EXPECT_EQ(verifies[0].data, "answer");
  EXPECT_NE(verifies[0].dataPointer, caller.bytes());
}

TEST_F(SessionVerifyTest, AnythingButBytesIsInvalidParameter) {
  openOrFail();
  log_->clear();
  const auto check = [&](const std::optional<Value>& signature, const std::optional<Value>& data, const std::string& line) {
    const auto [valid, error] = verify(signature, data);
    EXPECT_FALSE(valid);
    expectSessionError(error, -3, "An invalid parameter was provided by the caller.");
    EXPECT_EQ(log_->count(LogLevel::Info, line), 1) << ::testing::PrintToString(log_->lines());
  };
  check(Value("sig"), Value(dataOf("ab")),
        "[#TarvexSAPSession] Invalid parameter! (signature.class: String, data.class: Data, signature: \"sig\", data: " +
            dataOf("ab").description() + ")");
  check(Value(dataOf("ab")), Value(int64_t{5}),
        "[#TarvexSAPSession] Invalid parameter! (signature.class: Data, data.class: Number, signature: " +
            dataOf("ab").description() + ", data: 5)");
  check(std::nullopt, Value(dataOf("ab")),
        "[#TarvexSAPSession] Invalid parameter! (signature.class: (null), data.class: Data, signature: (null), data: " +
            dataOf("ab").description() + ")");
  check(Value(dataOf("ab")), std::nullopt,
        "[#TarvexSAPSession] Invalid parameter! (signature.class: Data, data.class: (null), signature: " +
            dataOf("ab").description() + ", data: (null))");
  // The typed entry point with no signature.
  const auto [valid, error] = verifyData(std::nullopt, dataOf("answer"));
  EXPECT_FALSE(valid);
  expectSessionError(error, -3, "An invalid parameter was provided by the caller.");
  EXPECT_TRUE(layer_->verifies().empty());
  EXPECT_EQ(stateInt(), 6u);
}

TEST_F(SessionVerifyTest, ClosedOrOpeningSessionCannotVerify) {
  {
    const auto [valid, error] = verifyData(dataOf("RSP(a)"), dataOf("a"));
    EXPECT_FALSE(valid);
    expectSessionError(error, -7, "Session must be open to verify signature.");
  }
  delegate_->handshake.hold();
  session_->openWithCompletionHandler(nullptr);
  ASSERT_TRUE(delegate_->handshake.waitHeld());
  {
    const auto [valid, error] = verifyData(dataOf("RSP(a)"), dataOf("a"));
    EXPECT_FALSE(valid);
    expectSessionError(error, -7, "Session must be open to verify signature.");
  }
  EXPECT_TRUE(layer_->verifies().empty());
  EXPECT_EQ(stateInt(), 4u);
}

TEST_F(SessionVerifyTest, AnEmptyCompletionDoesNothingAtAll) {
  openOrFail();
  log_->clear();
  session_->verifySignature(dataOf("RSP(a)"), dataOf("a"), nullptr);
  session_->verifySignature(std::optional<Value>(), std::optional<Value>(), nullptr);
  flush();
  EXPECT_TRUE(layer_->verifies().empty());
  EXPECT_TRUE(log_->lines().empty()) << ::testing::PrintToString(log_->lines());
}

}  // namespace
}  // namespace saptest
