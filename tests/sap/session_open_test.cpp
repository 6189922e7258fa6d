// Opening a session against the scripted primitive layer and delegate: the happy path with its
// state sequence and log lines, and every way an open can fail.
#include <gtest/gtest.h>

#include <cstring>

#include "sap_test_support.h"

namespace saptest {
namespace {

using platform::LogLevel;

constexpr char kOpening[] = "[#TarvexSAPSession] Opening session...";
constexpr char kClosing[] = "[#TarvexSAPSession] Closing session...";

class SessionOpenTest : public SessionTest {
 protected:
  // The open failed after the context was made: closed again, the handle torn down once.
  void expectClosedAfterFailure() {
    EXPECT_EQ(stateInt(), 0u);
    EXPECT_EQ(layer_->teardowns(), layer_->handles());
    EXPECT_EQ(layer_->handles().size(), 1u);
    EXPECT_EQ(log_->count(LogLevel::Default, kClosing), 1);
  }
};

TEST_F(SessionOpenTest, OpensThroughEveryStateInOrder) {
  auto done = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(done->handler());
  ASSERT_TRUE(done->wait());
  flush();
  EXPECT_EQ(done->calls(), 1);
  EXPECT_FALSE(std::get<0>(done->result()).has_value());
  EXPECT_EQ(done->queue(), session_->completionQueue().get());
  EXPECT_EQ(stateInt(), 6u);
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateOpen);

  auto lines = log_->lines();
  ASSERT_EQ(lines.size(), 10u) << ::testing::PrintToString(lines);
  EXPECT_EQ(lines[6].rfind("[#TarvexSAPSession] Setting TTL... (TTL: 3600.000000, self.expiration: ", 0), 0u) << lines[6];
  lines.erase(lines.begin() + 6);
  const std::vector<std::string> expected = {
      kOpening,
      "[#TarvexSAPSession] self.state_int: [Initialized]",
      "[#TarvexSAPSession] self.state_int: [Waiting For Certificate]",
      "[#TarvexSAPSession] Received certificate!",
      "[#TarvexSAPSession] self.state_int: [Generating Handshake Request]",
      "[#TarvexSAPSession] self.state_int: [Waiting For Handshake Response]",
      "[#TarvexSAPSession] Received handshake response!",
      "[#TarvexSAPSession] self.state_int: [Processing Handshake Response]",
      "[#TarvexSAPSession] self.state_int: [Open]",
  };
  EXPECT_EQ(lines, expected);
  EXPECT_EQ(log_->count(LogLevel::Info, kOpening), 1);
  EXPECT_EQ(log_->count(LogLevel::Info, "[#TarvexSAPSession] self.state_int: [Open]"), 1);
  EXPECT_EQ(log_->count(LogLevel::Info, "[#TarvexSAPSession] Received certificate!"), 1);
  EXPECT_EQ(log_->count(LogLevel::Info, "[#TarvexSAPSession] Received handshake response!"), 1);
  EXPECT_EQ(log_->countStartingWith("[#TarvexSAPSession] Setting TTL"), 1);
  for (const auto& e : log_->entries()) {
    if (e.message.rfind("[#TarvexSAPSession] Setting TTL", 0) == 0) {
      EXPECT_EQ(e.level, LogLevel::Debug);
    }
  }

  EXPECT_TRUE(delegate_->certificate.onDelegateQueue());
  EXPECT_TRUE(delegate_->handshake.onDelegateQueue());
  EXPECT_EQ(layer_->teardowns().size(), 0u);
}

TEST_F(SessionOpenTest, PassesTheContractArgumentsToThePrimitives) {
  delegate_->handshake.answerWith({dataOf("SESSION-INFO"), std::nullopt});
  openOrFail();
  ASSERT_EQ(layer_->initCalls(), 1);
  ASSERT_EQ(layer_->handles().size(), 1u);
  QVSAPContextOpaque_* const handle = layer_->handles()[0];
  TarvexHWInfo_* const hw = layer_->initHwInfos()[0];

  const auto exchanges = layer_->exchanges();
  ASSERT_EQ(exchanges.size(), 2u);
  for (const auto& call : exchanges) {
    EXPECT_EQ(call.selector, 200);
    EXPECT_EQ(call.hwInfo, hw);
    EXPECT_EQ(call.context, handle);
    EXPECT_TRUE(call.presetsUntouched) << "outputs must start null, 0 and 255";
  }
  EXPECT_EQ(exchanges[0].input, "CERT");
  EXPECT_EQ(exchanges[1].input, "SESSION-INFO");

  // The handshake request is the first exchange's buffer itself, handed over without a copy.
  const auto requests = delegate_->handshakeRequests();
  ASSERT_EQ(requests.size(), 1u);
  ASSERT_TRUE(requests[0].has_value());
  EXPECT_EQ(textOf(*requests[0]), "REQUEST(CERT)");
  EXPECT_EQ(requests[0]->bytes(), exchanges[0].outBuffer);
}

TEST_F(SessionOpenTest, HardwareInfoStartsZeroedAndIsKeptAcrossOpens) {
  openOrFail();
  session_->close();
  openOrFail();
  const auto infos = layer_->initHwInfos();
  const auto seen = layer_->initHwSnapshots();
  ASSERT_EQ(infos.size(), 2u);
  ASSERT_EQ(seen.size(), 2u);
  const TarvexHWInfo_ zero{};
  EXPECT_EQ(std::memcmp(&seen[0], &zero, sizeof zero), 0) << "the record must start zeroed";
  // Same record both times, still holding what the layer wrote into it the first time.
  EXPECT_EQ(infos[0], infos[1]);
  EXPECT_EQ(seen[1].IDLength, 4u);
  EXPECT_EQ(std::string(reinterpret_cast<const char*>(seen[1].ID), 4), "HWID");
}

TEST_F(SessionOpenTest, InitFailureReportsInternalErrorAndClosesNothing) {
  layer_->initStatus = -9;
  expectSessionError(open(), -4, "Could not initialize session.");
  flush();
  EXPECT_EQ(stateInt(), 0u);
  EXPECT_TRUE(layer_->teardowns().empty());
  EXPECT_EQ(delegate_->certificate.asks(), 0);
  EXPECT_EQ(log_->count(LogLevel::Error, "[#TarvexSAPSession] Could not initialize session! (status: -9)"), 1);
  EXPECT_EQ(log_->count(LogLevel::Default, kClosing), 0);
  EXPECT_EQ(log_->countStartingWith("[#TarvexSAPSession] self.state_int"), 0);

  // Nothing is left behind: the next open starts from scratch.
  layer_->initStatus = 0;
  openOrFail();
}

TEST_F(SessionOpenTest, CertificateErrorIsPassedOnUnchangedAndCloses) {
  const Error transport("SomeTransportDomain", -5,
                        platform::Dictionary{{"NSUnderlying", platform::Value(std::string("connection refused"))}});
  delegate_->certificate.answerWith({std::nullopt, transport});
  const auto error = open();
  ASSERT_TRUE(error.has_value());
  EXPECT_EQ(*error, transport);
  expectClosedAfterFailure();
  EXPECT_TRUE(layer_->exchanges().empty());
  EXPECT_EQ(log_->count(LogLevel::Error, "[#TarvexSAPSession] Error requesting certificate: " + transport.description()), 1);
}

TEST_F(SessionOpenTest, CertificateErrorWinsOverDataSentAlongWithIt) {
  const Error failure(TarvexSAPSessionErrorDomain, -6);
  delegate_->certificate.answerWith({dataOf("CERT"), failure});
  const auto error = open();
  ASSERT_TRUE(error.has_value());
  EXPECT_EQ(*error, failure);
  expectClosedAfterFailure();
  EXPECT_TRUE(layer_->exchanges().empty());
}

TEST_F(SessionOpenTest, MissingOrEmptyCertificateIsInvalidParameter) {
  bool retry = false;
  for (const std::optional<Data>& certificate : {std::optional<Data>(), std::optional<Data>(Data())}) {
    SCOPED_TRACE(certificate ? "empty" : "missing");
    delegate_->certificate.answerWith({certificate, std::nullopt});
    expectSessionError(open(), -3, "An invalid parameter was provided by the caller.");
    EXPECT_EQ(stateInt(), 0u);
    EXPECT_TRUE(layer_->exchanges().empty());
    EXPECT_EQ(log_->count(LogLevel::Default, "[#TarvexSAPSession] Invalid certificate received!"), 1);
    // A retry first closes the failed session once more (its close left an expiration in the past).
    EXPECT_EQ(log_->count(LogLevel::Default, kClosing), retry ? 2 : 1);
    retry = true;
    ASSERT_FALSE(layer_->handles().empty());
    EXPECT_EQ(layer_->teardowns().back(), layer_->handles().back());
    log_->clear();
  }
}

struct FirstExchangeCase {
  const char* name;
  ExchangeReply reply;
  const char* logLine;
};

class FirstExchangeFailureTest : public SessionOpenTest, public ::testing::WithParamInterface<FirstExchangeCase> {};

TEST_P(FirstExchangeFailureTest, FailsWithInternalErrorAndCloses) {
  const FirstExchangeCase& c = GetParam();
  layer_->exchangeScript = [reply = c.reply](int step, const std::string&) -> std::optional<ExchangeReply> {
    if (step == 1) return reply;
    return std::nullopt;
  };
  expectSessionError(open(), -4, "An internal error has occurred.");
  expectClosedAfterFailure();
  EXPECT_EQ(layer_->exchanges().size(), 1u);
  EXPECT_EQ(delegate_->handshake.asks(), 0);
  EXPECT_EQ(log_->count(LogLevel::Error, c.logLine), 1) << ::testing::PrintToString(log_->lines());
  // A returned buffer is freed: the leak checker of the sanitizer build watches it.
}

INSTANTIATE_TEST_SUITE_P(
    Replies, FirstExchangeFailureTest,
    ::testing::Values(
        FirstExchangeCase{"StatusFailure", {-2, 1, "REQ"},
                          "[#TarvexSAPSession] Could not generate handshake request data! (status: -2, returnCode: 1)"},
        FirstExchangeCase{"ReturnCodeZero", {0, 0, "REQ"},
                          "[#TarvexSAPSession] Could not generate handshake request data! (status: 0, returnCode: 0)"},
        FirstExchangeCase{"ReturnCodeUntouched", {0, std::nullopt, "REQ"},
                          "[#TarvexSAPSession] Could not generate handshake request data! (status: 0, returnCode: 255)"},
        FirstExchangeCase{"EmptyBuffer", {0, 1, ""},
                          "[#TarvexSAPSession] Could not generate handshake request data! (status: 0, returnCode: 1)"},
        FirstExchangeCase{"NullBuffer", {0, 1, std::nullopt},
                          "[#TarvexSAPSession] Could not generate handshake request data! (status: 0, returnCode: 1)"}),
    [](const ::testing::TestParamInfo<FirstExchangeCase>& info) { return std::string(info.param.name); });

TEST_F(SessionOpenTest, HandshakeErrorIsPassedOnUnchangedAndCloses) {
  const Error transport(TarvexSAPSessionErrorDomain, -5, platform::Dictionary{{"code", platform::Value(int64_t{7})}});
  delegate_->handshake.answerWith({std::nullopt, transport});
  const auto error = open();
  ASSERT_TRUE(error.has_value());
  EXPECT_EQ(*error, transport);
  expectClosedAfterFailure();
  EXPECT_EQ(layer_->exchanges().size(), 1u);
  EXPECT_EQ(log_->count(LogLevel::Error, "[#TarvexSAPSession] Error requesting handshake: " + transport.description()), 1);
  EXPECT_EQ(log_->countStartingWith("[#TarvexSAPSession] self.state_int: [Processing"), 0);
}

TEST_F(SessionOpenTest, MissingHandshakeResponseIsInvalidParameter) {
  delegate_->handshake.answerWith({std::nullopt, std::nullopt});
  expectSessionError(open(), -3, "An invalid parameter was provided by the caller.");
  expectClosedAfterFailure();
  EXPECT_EQ(layer_->exchanges().size(), 1u);
  EXPECT_EQ(log_->count(LogLevel::Default, "[#TarvexSAPSession] Invalid handshake response received!"), 1);
}

TEST_F(SessionOpenTest, EmptyHandshakeResponseGoesToThePrimitive) {
  delegate_->handshake.answerWith({Data(), std::nullopt});
  openOrFail();
  const auto exchanges = layer_->exchanges();
  ASSERT_EQ(exchanges.size(), 2u);
  EXPECT_EQ(exchanges[1].input, "");
  EXPECT_EQ(log_->count(LogLevel::Info, "[#TarvexSAPSession] Received handshake response!"), 1);
}

struct SecondExchangeCase {
  const char* name;
  ExchangeReply reply;
  bool opens;
  const char* logLine;  // for failures
};

class SecondExchangeTest : public SessionOpenTest, public ::testing::WithParamInterface<SecondExchangeCase> {};

TEST_P(SecondExchangeTest, OnlyStatusAndReturnCodeZeroOpen) {
  const SecondExchangeCase& c = GetParam();
  layer_->exchangeScript = [reply = c.reply](int step, const std::string&) -> std::optional<ExchangeReply> {
    if (step == 2) return reply;
    return std::nullopt;
  };
  const auto error = open();
  EXPECT_EQ(layer_->exchanges().size(), 2u);
  EXPECT_TRUE(layer_->exchanges()[1].presetsUntouched);
  if (c.opens) {
    EXPECT_FALSE(error.has_value());
    EXPECT_EQ(stateInt(), 6u);
    EXPECT_TRUE(layer_->teardowns().empty());
  } else {
    expectSessionError(error, -4, "An internal error has occurred.");
    expectClosedAfterFailure();
    EXPECT_EQ(log_->count(LogLevel::Error, c.logLine), 1) << ::testing::PrintToString(log_->lines());
  }
}

INSTANTIATE_TEST_SUITE_P(
    Replies, SecondExchangeTest,
    ::testing::Values(
        SecondExchangeCase{"Completes", {0, 0, std::nullopt}, true, ""},
        SecondExchangeCase{"CompletesWithUnreadBuffer", {0, 0, "EXTRA"}, true, ""},
        SecondExchangeCase{"AsksForAnotherRound", {0, 1, "ROUND2"}, false,
                           "[#TarvexSAPSession] Could not process handshake response! (status: 0, returnCode: 1)"},
        SecondExchangeCase{"StatusFailure", {-5, 0, std::nullopt}, false,
                           "[#TarvexSAPSession] Could not process handshake response! (status: -5, returnCode: 0)"},
        SecondExchangeCase{"StatusFailureWithBuffer", {-6, 0, "JUNK"}, false,
                           "[#TarvexSAPSession] Could not process handshake response! (status: -6, returnCode: 0)"},
        SecondExchangeCase{"ReturnCodeUntouched", {0, std::nullopt, std::nullopt}, false,
                           "[#TarvexSAPSession] Could not process handshake response! (status: 0, returnCode: 255)"}),
    [](const ::testing::TestParamInfo<SecondExchangeCase>& info) { return std::string(info.param.name); });

TEST_F(SessionOpenTest, OpeningAnOpenSessionIsInvalidStateAndChangesNothing) {
  openOrFail();
  log_->clear();
  expectSessionError(open(), -7, "Session is already open or initializing.");
  EXPECT_EQ(stateInt(), 6u);
  EXPECT_EQ(layer_->initCalls(), 1);
  EXPECT_TRUE(layer_->teardowns().empty());
  EXPECT_EQ(log_->count(LogLevel::Info, kOpening), 0);
}

TEST_F(SessionOpenTest, OpeningAnOpeningSessionIsInvalidStateAndTheFirstOpenGoesOn) {
  delegate_->certificate.hold();
  auto first = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(first->handler());
  ASSERT_TRUE(delegate_->certificate.waitHeld());

  expectSessionError(open(), -7, "Session is already open or initializing.");
  EXPECT_EQ(stateInt(), 2u);
  EXPECT_EQ(layer_->initCalls(), 1);

  delegate_->certificate.release({dataOf("CERT"), std::nullopt});
  ASSERT_TRUE(first->wait());
  EXPECT_FALSE(std::get<0>(first->result()).has_value());
  EXPECT_EQ(stateInt(), 6u);
}

TEST_F(SessionOpenTest, AnEmptyCompletionStillOpens) {
  delegate_->handshake.hold();
  session_->openWithCompletionHandler(nullptr);
  ASSERT_TRUE(delegate_->handshake.waitHeld());
  delegate_->handshake.release({dataOf("INFO"), std::nullopt});
  EXPECT_EQ(stateInt(), 6u);  // the continuation was queued before this read
  EXPECT_EQ(layer_->exchanges().size(), 2u);
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateOpen);
}

TEST_F(SessionOpenTest, AFailedOpenCanBeRetried) {
  delegate_->handshake.answerWith({std::nullopt, Error(TarvexSAPSessionErrorDomain, -6)});
  const auto error = open();
  ASSERT_TRUE(error.has_value());
  EXPECT_EQ(error->code(), -6);
  delegate_->handshake.answerWith({dataOf("INFO"), std::nullopt});
  openOrFail();
  // The retry closed the failed context once more (its close set an expiration in the past)
  // before it made a new one.
  const auto handles = layer_->handles();
  ASSERT_EQ(handles.size(), 2u);
  EXPECT_EQ(layer_->events(),
            (std::vector<std::string>{"init:1", "exchange:1", "teardown:1", "teardown:1", "init:2", "exchange:2",
                                      "exchange:2"}));
}

}  // namespace
}  // namespace saptest
