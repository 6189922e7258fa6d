// Life of a session: expiration, close, reopen, destruction, the accessors, and opens whose
// delegate answers late, twice, or never.
#include <gtest/gtest.h>

#include <regex>
#include <set>

#include "platform/exception.h"
#include "sap_test_support.h"

namespace saptest {
namespace {

using platform::LogLevel;
using platform::Value;

constexpr char kClosing[] = "[#TarvexSAPSession] Closing session...";
constexpr char kExpired[] = "[#TarvexSAPSession] Session is past expiration, closing session...";

class SessionExpirationTest : public SessionTest {};

TEST_F(SessionExpirationTest, SigningAfterExpirationClosesTheSession) {
  for (double ttl : {0.0, -30.0}) {
    SCOPED_TRACE(ttl);
    openOrFail();
    QVSAPContextOpaque_* const handle = layer_->handles().back();
    const size_t teardownsBefore = layer_->teardowns().size();
    session_->setTTL(ttl);
    log_->clear();
    const auto [signature, error] = sign(Value(dataOf("body")));
    EXPECT_FALSE(signature.has_value());
    expectSessionError(error, -7, "Session must be open to generate signature.");
    EXPECT_EQ(stateInt(), 0u);
    const auto teardowns = layer_->teardowns();
    ASSERT_EQ(teardowns.size(), teardownsBefore + 1);
    EXPECT_EQ(teardowns.back(), handle);
    EXPECT_TRUE(layer_->signs().empty());
    const std::vector<std::string> expected = {"[#TarvexSAPSession] Generating signature...", kExpired, kClosing,
                                               "[#TarvexSAPSession] self.state_int: [Closed]"};
    EXPECT_EQ(log_->lines(), expected);
    EXPECT_EQ(log_->count(LogLevel::Default, kExpired), 1);
  }
}

TEST_F(SessionExpirationTest, TTLReportsTimeLeftWithoutClosing) {
  EXPECT_EQ(session_->TTL(), 0.0);
  openOrFail();
  const double left = session_->TTL();
  EXPECT_GT(left, 3500.0);
  EXPECT_LE(left, 3600.0);

  session_->setTTL(-5);
  const double past = session_->TTL();
  EXPECT_LT(past, -4.9);
  EXPECT_GT(past, -3600.0);
  EXPECT_EQ(stateInt(), 6u) << "TTL must not run the expiration check";
  EXPECT_TRUE(layer_->teardowns().empty());

  session_->close();
  EXPECT_EQ(session_->TTL(), 0.0);
}

TEST_F(SessionExpirationTest, StateRunsTheExpirationCheck) {
  openOrFail();
  session_->setTTL(-1);
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
  EXPECT_EQ(layer_->teardowns(), layer_->handles());
  EXPECT_EQ(log_->count(LogLevel::Default, kExpired), 1);
}

TEST_F(SessionExpirationTest, VerificationRunsTheCheckOnlyAfterThePrimitive) {
  openOrFail();
  session_->setTTL(-1);
  const auto [valid, error] = verify(Value(dataOf("RSP(a)")), Value(dataOf("a")));
  EXPECT_TRUE(valid);
  EXPECT_FALSE(error.has_value());
  EXPECT_EQ(layer_->events(),
            (std::vector<std::string>{"init:1", "exchange:1", "exchange:1", "verify:1", "teardown:1"}));
  EXPECT_EQ(stateInt(), 0u);
}

// The TTL comes from the server's answer: any finite number must give a sane expiration.
TEST_F(SessionExpirationTest, HugeTTLKeepsTheSessionOpenAndLogsAFarDate) {
  openOrFail();
  log_->clear();
  session_->setTTL(1e300);
  EXPECT_GT(session_->TTL(), 1e299);
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateOpen);
  EXPECT_TRUE(sign(Value(dataOf("body"))).first.has_value());
  const auto lines = log_->lines();
  ASSERT_FALSE(lines.empty());
  const std::string head = "[#TarvexSAPSession] Setting TTL... (TTL: ";
  ASSERT_EQ(lines[0].rfind(head, 0), 0u) << lines[0];
  const size_t at = lines[0].find("self.expiration: ");
  ASSERT_NE(at, std::string::npos) << lines[0];
  const int year = std::stoi(lines[0].substr(at + 17, 4));
  EXPECT_GE(year, 2025) << "expiration logged in the past: " << lines[0];
}

TEST_F(SessionExpirationTest, FirstOpenWithoutTTLNeverExpires) {
  delegate_->setTTLBeforeHandshakeAnswer(std::nullopt);
  openOrFail();
  EXPECT_GT(session_->TTL(), 100.0 * 365 * 24 * 3600);
  EXPECT_TRUE(sign(Value(dataOf("body"))).first.has_value());
}

TEST_F(SessionExpirationTest, ReopeningAnExpiredSessionTearsTheOldContextDownFirst) {
  openOrFail();
  session_->setTTL(-1);
  log_->clear();
  openOrFail();
  EXPECT_EQ(layer_->events(), (std::vector<std::string>{"init:1", "exchange:1", "exchange:1", "teardown:1", "init:2",
                                                        "exchange:2", "exchange:2"}));
  const auto lines = log_->lines();
  ASSERT_GE(lines.size(), 4u);
  EXPECT_EQ(lines[0], kExpired);
  EXPECT_EQ(lines[1], kClosing);
  EXPECT_EQ(lines[3], "[#TarvexSAPSession] Opening session...");
}

TEST_F(SessionExpirationTest, ReopeningAClosedSessionTearsTheOldHandleDownAgain) {
  openOrFail();
  session_->close();
  openOrFail();
  EXPECT_EQ(layer_->events(), (std::vector<std::string>{"init:1", "exchange:1", "exchange:1", "teardown:1", "teardown:1",
                                                        "init:2", "exchange:2", "exchange:2"}));
}

TEST_F(SessionExpirationTest, AReopenedSessionWithoutNewTTLClosesAtFirstUse) {
  openOrFail();
  session_->close();
  delegate_->setTTLBeforeHandshakeAnswer(std::nullopt);
  openOrFail();
  EXPECT_LT(session_->TTL(), 0.0);
  const auto [signature, error] = sign(Value(dataOf("body")));
  EXPECT_FALSE(signature.has_value());
  expectSessionError(error, -7, "Session must be open to generate signature.");
  EXPECT_EQ(layer_->teardowns().back(), layer_->handles().back());
}

// A reopened session carries the past expiration of its last close until the handshake answer
// sets a new one; nothing that runs meanwhile may tear down the context the open is using.
TEST_F(SessionExpirationTest, AnOpeningSessionNeverExpires) {
  openOrFail();
  session_->close();
  delegate_->setTTLBeforeHandshakeAnswer(std::nullopt);
  delegate_->certificate.hold();
  delegate_->handshake.hold();
  auto reopened = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(reopened->handler());
  ASSERT_TRUE(delegate_->certificate.waitHeld());
  const size_t teardowns = layer_->teardowns().size();

  EXPECT_EQ(session_->state(), TarvexSAPSessionStateInitializing);
  expectSessionError(sign(Value(dataOf("body"))).second, -7, "Session must be open to generate signature.");
  EXPECT_EQ(session_->description(), "TarvexSAPSession <state: [Initializing], TTL: 0.000000s>");
  delegate_->certificate.release({dataOf("CERT"), std::nullopt});
  ASSERT_TRUE(delegate_->handshake.waitHeld());
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateInitializing);
  expectSessionError(sign(Value(dataOf("body"))).second, -7, "Session must be open to generate signature.");
  EXPECT_EQ(layer_->teardowns().size(), teardowns);
  EXPECT_EQ(log_->count(LogLevel::Default, kExpired), 1);  // only the reopen's own check

  delegate_->handshake.release({dataOf("INFO"), std::nullopt});
  ASSERT_TRUE(reopened->wait());
  EXPECT_FALSE(std::get<0>(reopened->result()).has_value());
  EXPECT_EQ(layer_->teardowns().size(), teardowns);
  // Open now, and the expiration is still the old one: the next check closes it.
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
  EXPECT_EQ(layer_->teardowns().back(), layer_->handles().back());
}

class SessionCloseTest : public SessionTest {};

TEST_F(SessionCloseTest, ClosingAFreshSessionCallsNoTeardown) {
  session_->close();
  flush();
  EXPECT_EQ(log_->count(LogLevel::Default, kClosing), 1);
  EXPECT_EQ(log_->count(LogLevel::Info, "[#TarvexSAPSession] self.state_int: [Closed]"), 1);
  EXPECT_TRUE(layer_->teardowns().empty());
  EXPECT_EQ(stateInt(), 0u);
}

TEST_F(SessionCloseTest, ClosingTwiceTearsTheSameHandleDownTwice) {
  openOrFail();
  session_->close();
  session_->close();
  flush();
  const auto handle = layer_->handles().at(0);
  EXPECT_EQ(layer_->teardowns(), (std::vector<QVSAPContextOpaque_*>{handle, handle}));
  EXPECT_EQ(log_->count(LogLevel::Default, kClosing), 2);
  EXPECT_EQ(stateInt(), 0u);
  EXPECT_EQ(session_->TTL(), 0.0);
}

TEST_F(SessionCloseTest, TeardownFailureIsLoggedAndTheSessionStillCloses) {
  openOrFail();
  layer_->teardownStatus = -3;
  session_->close();
  flush();
  EXPECT_EQ(log_->count(LogLevel::Error, "[#TarvexSAPSession] Could not tear down Tarvex SAP session!"), 1);
  EXPECT_EQ(stateInt(), 0u);
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
  // And it can be opened again.
  layer_->teardownStatus = 0;
  openOrFail();
}

TEST_F(SessionCloseTest, CloseReturnsBeforeTheCloseRuns) {
  openOrFail();
  // Block the internal queue so the close can only be queued.
  platform::Semaphore entered, proceed;
  session_->internalQueue()->async([&] {
    entered.signal();
    proceed.waitFor(kGuard);
  });
  ASSERT_TRUE(entered.waitFor(kGuard));
  session_->close();
  EXPECT_TRUE(layer_->teardowns().empty());
  proceed.signal();
  EXPECT_EQ(stateInt(), 0u);
  EXPECT_EQ(layer_->teardowns().size(), 1u);
}

class SessionObjectTest : public SessionTest {};

TEST_F(SessionObjectTest, FreshSessionDescription) {
  EXPECT_EQ(session_->description(), "TarvexSAPSession <state: [Closed], TTL: 0.000000s>");
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
}

TEST_F(SessionObjectTest, OpenSessionDescription) {
  openOrFail();
  const std::string description = session_->description();
  EXPECT_TRUE(std::regex_match(description, std::regex(R"(TarvexSAPSession <state: \[Open\], TTL: 35\d\d\.\d{6}s>)")))
      << description;
}

TEST_F(SessionObjectTest, PlainInitIsForbidden) {
  try {
    TarvexSAPSession::init();
    ADD_FAILURE() << "init() returned";
  } catch (const platform::InternalInconsistencyException& e) {
    EXPECT_STREQ(e.what(), "Must use +[TarvexSAPSession initWithDelegate:] instead of +[TarvexSAPSession init]!");
  }
}

TEST_F(SessionObjectTest, QueuesAreLabelledAndKindedPerSession) {
  const std::regex label(R"(TarvexSAPSession-(\d+)\.(completionQueue|internalQueue|delegateQueue))");
  std::smatch m;
  std::set<std::string> hashes;
  for (const auto& [queue, suffix] : {std::pair{session_->completionQueue(), "completionQueue"},
                                      std::pair{session_->internalQueue(), "internalQueue"},
                                      std::pair{session_->delegateQueue(), "delegateQueue"}}) {
    ASSERT_TRUE(std::regex_match(queue->label(), m, label)) << queue->label();
    EXPECT_EQ(m[2].str(), suffix);
    hashes.insert(m[1].str());
  }
  EXPECT_EQ(hashes.size(), 1u) << "one hash per session";
  EXPECT_TRUE(session_->internalQueue()->isSerial());
  EXPECT_FALSE(session_->completionQueue()->isSerial());
  EXPECT_FALSE(session_->delegateQueue()->isSerial());

  auto other = TarvexSAPSession::sessionWithDelegate(delegate_, layer_->primitives());
  ASSERT_TRUE(std::regex_match(other->internalQueue()->label(), m, label));
  EXPECT_EQ(hashes.count(m[1].str()), 0u) << "two sessions share a queue label";
  EXPECT_NE(other->UUID(), session_->UUID());
  EXPECT_EQ(session_->UUID().UUIDString().size(), 36u);
  EXPECT_EQ(session_->delegate().lock(), delegate_);
}

TEST_F(SessionObjectTest, DestructionClosesAfterQueuedWork) {
  openOrFail();
  auto signed1 = std::make_shared<SignRecorder>();
  session_->signatureForData(dataOf("last words"), signed1->handler());
  log_->clear();
  session_.reset();
  ASSERT_TRUE(lifetime_->waitGone());
  ASSERT_TRUE(signed1->wait());
  EXPECT_TRUE(std::get<0>(signed1->result()).has_value());
  EXPECT_EQ(layer_->events(),
            (std::vector<std::string>{"init:1", "exchange:1", "exchange:1", "sign:1", "teardown:1"}));
  EXPECT_EQ(log_->count(LogLevel::Default, kClosing), 1);
}

TEST_F(SessionObjectTest, CompletionsMayUseTheBlockingAccessors) {
  platform::Semaphore done;
  TarvexSAPSessionState seen = TarvexSAPSessionStateClosed;
  std::string description;
  session_->openWithCompletionHandler([&, session = session_.get()](std::optional<Error>) {
    seen = session->state();
    description = session->description();
    session->setTTL(60);
    done.signal();
  });
  ASSERT_TRUE(done.waitFor(kGuard)) << "an accessor called from a completion deadlocked";
  EXPECT_EQ(seen, TarvexSAPSessionStateOpen);
  EXPECT_EQ(description.rfind("TarvexSAPSession <state: [Open], TTL: ", 0), 0u) << description;
  EXPECT_LE(session_->TTL(), 60.0);
}

TEST_F(SessionObjectTest, LastReferenceDroppedInsideACompletion) {
  openOrFail();
  platform::Semaphore done;
  auto holder = std::make_shared<std::shared_ptr<TarvexSAPSession>>(session_);
  session_.reset();
  (*holder)->signatureForData(dataOf("body"), [holder, &done](std::optional<Data>, std::optional<Error>) {
    holder->reset();  // the last reference, unless the signing work still holds one
    done.signal();
  });
  ASSERT_TRUE(done.waitFor(kGuard));
  ASSERT_TRUE(lifetime_->waitGone());
  EXPECT_EQ(layer_->events(),
            (std::vector<std::string>{"init:1", "exchange:1", "exchange:1", "sign:1", "teardown:1"}));
}

TEST_F(SessionObjectTest, DestructionOfAFreshSessionTearsNothingDown) {
  session_.reset();
  ASSERT_TRUE(lifetime_->waitGone());
  EXPECT_TRUE(layer_->teardowns().empty());
}

class SessionDelegateTest : public SessionTest {};

TEST_F(SessionDelegateTest, OpenNeverCompletesWithoutADelegate) {
  delegate_.reset();  // the session holds it weakly
  auto done = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(done->handler());
  EXPECT_FALSE(done->wait(std::chrono::milliseconds(200)));
  // Everything queued so far has run; still no completion and no crash.
  flush();
  flush();
  EXPECT_EQ(done->calls(), 0);
  EXPECT_EQ(stateInt(), 2u);
  EXPECT_TRUE(layer_->exchanges().empty());
  // Destruction still tears the context down.
  session_.reset();
  ASSERT_TRUE(lifetime_->waitGone());
  EXPECT_EQ(layer_->teardowns(), layer_->handles());
  EXPECT_EQ(done->calls(), 0);
}

TEST_F(SessionDelegateTest, CloseWhileWaitingForTheCertificateMakesTheLateAnswerInvalidState) {
  delegate_->certificate.hold();
  auto done = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(done->handler());
  ASSERT_TRUE(delegate_->certificate.waitHeld());
  session_->close();
  EXPECT_EQ(stateInt(), 0u);
  const auto events = layer_->events();
  log_->clear();

  delegate_->certificate.release({dataOf("CERT"), std::nullopt});
  ASSERT_TRUE(done->wait());
  expectSessionError(std::get<0>(done->result()), -7, "Cannot perform this action in the current state.");
  flush();
  EXPECT_EQ(done->calls(), 1);
  EXPECT_EQ(layer_->events(), events) << "the late answer touched the layer";
  EXPECT_EQ(stateInt(), 0u);
  EXPECT_TRUE(log_->lines().empty()) << ::testing::PrintToString(log_->lines());
}

TEST_F(SessionDelegateTest, CloseWhileWaitingForTheHandshakeMakesTheLateAnswerInvalidState) {
  delegate_->handshake.hold();
  auto done = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(done->handler());
  ASSERT_TRUE(delegate_->handshake.waitHeld());
  session_->close();
  EXPECT_EQ(stateInt(), 0u);
  const auto events = layer_->events();
  log_->clear();

  // Even an error answer must not close again.
  delegate_->handshake.release({std::nullopt, Error(TarvexSAPSessionErrorDomain, -5)});
  ASSERT_TRUE(done->wait());
  expectSessionError(std::get<0>(done->result()), -7, "Cannot perform this action in the current state.");
  flush();
  EXPECT_EQ(layer_->events(), events);
  EXPECT_EQ(layer_->exchanges().size(), 1u);
  EXPECT_TRUE(log_->lines().empty()) << ::testing::PrintToString(log_->lines());
}

TEST_F(SessionDelegateTest, AStaleAnswerDoesNotFeedANewerOpen) {
  delegate_->certificate.hold();
  auto first = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(first->handler());
  ASSERT_TRUE(delegate_->certificate.waitHeld());
  session_->close();
  auto second = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(second->handler());
  ASSERT_TRUE(delegate_->certificate.waitHeld());
  EXPECT_EQ(stateInt(), 2u);

  // The first open's answer arrives while the second waits for its own.
  delegate_->certificate.release({dataOf("STALE"), std::nullopt});
  ASSERT_TRUE(first->wait());
  expectSessionError(std::get<0>(first->result()), -7, "Cannot perform this action in the current state.");
  EXPECT_EQ(stateInt(), 2u);
  EXPECT_TRUE(layer_->exchanges().empty());

  delegate_->certificate.release({dataOf("CERT"), std::nullopt});
  ASSERT_TRUE(second->wait());
  EXPECT_FALSE(std::get<0>(second->result()).has_value());
  const auto exchanges = layer_->exchanges();
  ASSERT_EQ(exchanges.size(), 2u);
  EXPECT_EQ(exchanges[0].input, "CERT");
  EXPECT_EQ(exchanges[0].context, layer_->handles().at(1));
  EXPECT_EQ(first->calls(), 1);
}

class SessionDuplicateAnswerTest : public SessionTest, public ::testing::WithParamInterface<bool> {};

// A delegate that calls its completion twice must not change the outcome of the open: one
// completion, the real one, and the duplicate touches nothing.
TEST_P(SessionDuplicateAnswerTest, OneRealCompletionPerOpen) {
  ScriptedDelegate::Slot& slot = GetParam() ? delegate_->certificate : delegate_->handshake;
  slot.answerTwice();
  for (int round = 0; round < 2; ++round) {
    SCOPED_TRACE(round);
    auto done = std::make_shared<OpenRecorder>();
    session_->openWithCompletionHandler(done->handler());
    ASSERT_TRUE(done->wait());
    flush();
    flush();
    EXPECT_EQ(done->calls(), 1);
    const auto error = std::get<0>(done->result());
    EXPECT_FALSE(error.has_value()) << error->description();
    EXPECT_EQ(stateInt(), 6u);
    session_->close();
    flush();
  }
  EXPECT_EQ(layer_->initCalls(), 2);
  EXPECT_EQ(layer_->exchanges().size(), 4u);
  EXPECT_TRUE(layer_->deadHandleUses().empty());
}

INSTANTIATE_TEST_SUITE_P(Stages, SessionDuplicateAnswerTest, ::testing::Bool(),
                         [](const ::testing::TestParamInfo<bool>& info) {
                           return std::string(info.param ? "Certificate" : "Handshake");
                         });

TEST_F(SessionDelegateTest, ADelegateFailingTwiceClosesOnce) {
  delegate_->certificate.answerWith({std::nullopt, Error(TarvexSAPSessionErrorDomain, -5)});
  delegate_->certificate.answerTwice();
  auto done = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(done->handler());
  ASSERT_TRUE(done->wait());
  flush();
  EXPECT_EQ(done->calls(), 1);
  EXPECT_EQ(std::get<0>(done->result())->code(), -5);
  EXPECT_EQ(layer_->teardowns().size(), 1u);
  EXPECT_EQ(log_->count(LogLevel::Default, kClosing), 1);
}

TEST_F(SessionDelegateTest, AnswersFromAnyThreadAreTakenBackToTheSession) {
  delegate_->certificate.hold();
  delegate_->handshake.hold();
  auto done = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(done->handler());
  ASSERT_TRUE(delegate_->certificate.waitHeld());
  std::thread([&] { delegate_->certificate.release({dataOf("CERT"), std::nullopt}); }).join();
  ASSERT_TRUE(delegate_->handshake.waitHeld());
  std::thread([&] { delegate_->handshake.release({dataOf("INFO"), std::nullopt}); }).join();
  ASSERT_TRUE(done->wait());
  EXPECT_FALSE(std::get<0>(done->result()).has_value());
  EXPECT_EQ(done->queue(), session_->completionQueue().get());
}

}  // namespace
}  // namespace saptest
