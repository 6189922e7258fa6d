// The session's state machine against the faked primitives and delegate: every way an open, a
// signature and a verification end (state, error, log line), then closing, expiration and the
// object's own rules.
#include <regex>
#include <thread>

#include "common/rows.h"
#include "platform/exception.h"
#include "session_fakes.h"

namespace saptest {
namespace {

using platform::LogLevel;
constexpr LogLevel kInfo = LogLevel::Info, kDefault = LogLevel::Default, kError = LogLevel::Error;

const Error kTransport("SomeTransportDomain", -5, platform::Dictionary{{"NSUnderlying", Value("refused")}});
const Error kInvalid = QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidParameter);
const Error kInternal = QVSAPS_errorWithCode(TarvexSAPSessionErrorInternal);
const Error kSignOnlyOpen =
    QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState, "Session must be open to generate signature.");
const Error kVerifyOnlyOpen =
    QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState, "Session must be open to verify signature.");
const std::string kS = "[#TarvexSAPSession] ";
const std::string kNoRequest = kS + "Could not generate handshake request data! (status: ";
const std::string kNoAnswer = kS + "Could not process handshake response! (status: ";
const std::string kCertificateError = kS + "Error requesting certificate: " + kTransport.description();
const std::string kHandshakeError = kS + "Error requesting handshake: " + kTransport.description();

// What differs from the fakes' defaults.
struct Script {
  int32_t initStatus = 0;
  std::optional<Answer> certificate = std::nullopt, handshake = std::nullopt;
  std::optional<Exchange> first = std::nullopt, second = std::nullopt;
};

struct OpenRow {
  const char* name;
  Script script;
  std::optional<Error> error;  // nullopt: the session opens
  int teardowns;
  LogLevel level;
  std::string line;
};

// clang-format off
const OpenRow kOpens[] = {
  {"Opens", {}, std::nullopt, 0, kInfo, kS + "self.state_int: [Open]"},
  {"InitFails", {.initStatus = -9}, QVSAPS_errorWithCode(-4, "Could not initialize session."), 0, kError, kS + "Could not initialize session! (status: -9)"},
  {"CertificateErrorPassesThrough", {.certificate = Answer{std::nullopt, kTransport}}, kTransport, 1, kError, kCertificateError},
  {"CertificateErrorWinsOverItsData", {.certificate = Answer{Data::fromString("CERT"), kTransport}}, kTransport, 1, kError, kCertificateError},
  {"NoCertificate", {.certificate = Answer{}}, kInvalid, 1, kDefault, kS + "Invalid certificate received!"},
  {"EmptyCertificate", {.certificate = Answer{Data()}}, kInvalid, 1, kDefault, kS + "Invalid certificate received!"},
  {"RequestStatusFails", {.first = Exchange{-2, 1, "REQ"}}, kInternal, 1, kError, kNoRequest + "-2, returnCode: 1)"},
  {"RequestWithReturnCodeZero", {.first = Exchange{0, 0, "REQ"}}, kInternal, 1, kError, kNoRequest + "0, returnCode: 0)"},
  {"RequestWithoutReturnCode", {.first = Exchange{0, std::nullopt, "REQ"}}, kInternal, 1, kError, kNoRequest + "0, returnCode: 255)"},
  {"EmptyRequest", {.first = Exchange{0, 1, ""}}, kInternal, 1, kError, kNoRequest + "0, returnCode: 1)"},
  {"NoRequest", {.first = Exchange{0, 1, std::nullopt}}, kInternal, 1, kError, kNoRequest + "0, returnCode: 1)"},
  {"HandshakeErrorPassesThrough", {.handshake = Answer{std::nullopt, kTransport}}, kTransport, 1, kError, kHandshakeError},
  {"NoHandshakeAnswer", {.handshake = Answer{}}, kInvalid, 1, kDefault, kS + "Invalid handshake response received!"},
  // Empty is still an answer: the primitive judges it.
  {"EmptyHandshakeAnswer", {.handshake = Answer{Data()}}, std::nullopt, 0, kInfo, kS + "Received handshake response!"},
  // One round trip only: a primitive that wants another round has failed.
  {"AnotherRoundWanted", {.second = Exchange{0, 1, "ROUND2"}}, kInternal, 1, kError, kNoAnswer + "0, returnCode: 1)"},
  {"AnswerStatusFails", {.second = Exchange{-5, 0, "JUNK"}}, kInternal, 1, kError, kNoAnswer + "-5, returnCode: 0)"},
  {"AnswerWithoutReturnCode", {.second = Exchange{0, std::nullopt, std::nullopt}}, kInternal, 1, kError, kNoAnswer + "0, returnCode: 255)"},
  {"UnreadOutputAfterTheAnswer", {.second = Exchange{0, 0, "EXTRA"}}, std::nullopt, 0, kInfo, kS + "self.state_int: [Open]"},
};
// clang-format on

class OpenTest : public SessionTest, public ::testing::WithParamInterface<OpenRow> {};

TEST_P(OpenTest, EndsInItsStateWithItsErrorAndLine) {
  const Script& script = GetParam().script;
  primitives_->initStatus = script.initStatus;
  primitives_->first = script.first;
  primitives_->second = script.second;
  if (script.certificate) delegate_->certificate = script.certificate;
  if (script.handshake) delegate_->handshake = script.handshake;
  EXPECT_EQ(open(), GetParam().error);
  EXPECT_EQ(stateInt(), GetParam().error ? 0u : 6u);
  EXPECT_EQ(primitives_->count("teardown"), GetParam().teardowns);
  EXPECT_EQ(log_.count(GetParam().level, GetParam().line), 1) << log_.dump();
}

ZLKA_ROWS(OpenTest, OpenRow, kOpens);

enum Before { Closed, Opening, Open, Expired };

struct UseRow {
  const char* name;
  Before before;
  bool verify;
  std::optional<Value> first, second;  // signing: the data; verifying: the signature, the data
  int32_t status;                      // what the primitive answers when called
  bool reachesPrimitive;
  std::optional<Error> error;  // nullopt: signed "SIG(body)", or verified
  uint64_t stateAfter;
  LogLevel level;
  std::string line;
};

const Value kBody(Data::fromString("body")), kAnswer(Data::fromString("answer")),
    kGood(Data::fromString("RSP(answer)"));
const std::string kExpired = kS + "Session is past expiration, closing session...";
const std::string kBadSignature = kS + "Signature verification failed! (status: ";

// clang-format off
const UseRow kUses[] = {
  {"Signs", Open, false, kBody, {}, 0, true, std::nullopt, 6, kInfo, kS + "Generating signature..."},
  {"SigningAStringIsInvalid", Open, false, Value("a string"), {}, 0, false, kInvalid, 6, kInfo,
   kS + "Invalid parameter! (data.class: String, data: \"a string\")"},
  // The argument is checked before the state.
  {"SigningNothingIsInvalid", Closed, false, std::nullopt, {}, 0, false, kInvalid, 0, kInfo,
   kS + "Invalid parameter! (data.class: (null), data: (null))"},
  {"FailedSignatureKeepsTheSessionOpen", Open, false, kBody, {}, -6, true, kInvalid, 6, kError, kS + "Could not generate signature! (status: -6)"},
  {"ClosedCannotSign", Closed, false, kBody, {}, 0, false, kSignOnlyOpen, 0, kInfo, kS + "Generating signature..."},
  {"OpeningCannotSign", Opening, false, kBody, {}, 0, false, kSignOnlyOpen, 2, kInfo, kS + "Generating signature..."},
  {"ExpiredClosesBeforeSigning", Expired, false, kBody, {}, 0, false, kSignOnlyOpen, 0, kDefault, kExpired},
  {"Verifies", Open, true, kGood, kAnswer, 0, true, std::nullopt, 6, kInfo, kS + "Verifying signature..."},
  {"RejectedSignatureKeepsTheSessionOpen", Open, true, Value(Data::fromString("RSP(other)")), kAnswer, 0, true, kInvalid, 6, kDefault, kBadSignature + "-6)"},
  {"AnyNonZeroStatusRejects", Open, true, kGood, kAnswer, 3, true, kInvalid, 6, kDefault, kBadSignature + "3)"},
  {"VerifyingAStringIsInvalid", Open, true, Value("sig"), kAnswer, 0, false, kInvalid, 6, kInfo,
   kS + "Invalid parameter! (signature.class: String, data.class: Data, signature: \"sig\", data: " + kAnswer.description() + ")"},
  {"VerifyingNothingIsInvalid", Open, true, kGood, std::nullopt, 0, false, kInvalid, 6, kInfo,
   kS + "Invalid parameter! (signature.class: Data, data.class: (null), signature: " + kGood.description() + ", data: (null))"},
  {"ClosedCannotVerify", Closed, true, kGood, kAnswer, 0, false, kVerifyOnlyOpen, 0, kInfo, kS + "Verifying signature..."},
  {"OpeningCannotVerify", Opening, true, kGood, kAnswer, 0, false, kVerifyOnlyOpen, 2, kInfo, kS + "Verifying signature..."},
  // The expiration is checked only after the primitive has judged the answer.
  {"ExpiredVerifiesThenCloses", Expired, true, kGood, kAnswer, 0, true, std::nullopt, 0, kDefault, kExpired},
};
// clang-format on

class UseTest : public SessionTest, public ::testing::WithParamInterface<UseRow> {};

TEST_P(UseTest, EndsWithItsResultStateAndLine) {
  const UseRow& row = GetParam();
  if (row.before == Opening) {
    delegate_->certificate = std::nullopt;
    startOpen();
    ASSERT_TRUE(delegate_->waitHeld());
  }
  if (row.before == Open || row.before == Expired) {
    ASSERT_NO_FATAL_FAILURE(openOrFail());
  }
  if (row.before == Expired) session_->setTTL(-1);
  primitives_->signStatus = primitives_->verifyStatus = row.status;
  const size_t mark = log_.size();
  // Data shares its bytes between copies: only text taken before shows a write into them.
  auto text = [&] { return row.second && row.second->data() ? std::string(row.second->data()->view()) : ""; };
  const std::string data = text();
  const auto [ok, error] = row.verify ? verify(row.first, row.second) : [&] {
    auto [signature, error] = sign(row.first);
    return std::pair(signature == Data::fromString("SIG(body)"), error);
  }();
  EXPECT_EQ(ok, !row.error);
  EXPECT_EQ(error, row.error);
  EXPECT_EQ(text(), data) << "the primitive wrote into the caller's data";
  EXPECT_EQ(stateInt(), row.stateAfter);
  EXPECT_EQ(primitives_->count(row.verify ? "verify" : "sign"), row.reachesPrimitive ? 1 : 0);
  EXPECT_EQ(log_.count(row.level, row.line, mark), 1) << log_.dump();
}

ZLKA_ROWS(UseTest, UseRow, kUses);

TEST_F(SessionTest, OpensThroughEveryStateInOrder) {
  openOrFail();
  std::vector<std::string> states;
  for (const auto& e : log_.entries())
    if (e.level == LogLevel::Info && e.message.starts_with(kS + "self.state_int: "))
      states.push_back(e.message.substr(kS.size() + 16));
  EXPECT_EQ(states, (std::vector<std::string>{"[Initialized]", "[Waiting For Certificate]",
                                              "[Generating Handshake Request]", "[Waiting For Handshake Response]",
                                              "[Processing Handshake Response]", "[Open]"}));
}

// A close keeps the handle: every later close, and the next open's expiration check, tear it
// down again (the primitives refuse a dead handle harmlessly).
TEST_F(SessionTest, ClosingTearsTheContextDownAndLogsAFailedTeardown) {
  session_->close();
  flush();
  EXPECT_TRUE(primitives_->events().empty());
  EXPECT_EQ(log_.count(LogLevel::Default, kS + "Closing session..."), 1);
  openOrFail();
  primitives_->teardownStatus = -3;
  session_->close();
  session_->close();
  EXPECT_EQ(stateInt(), 0u);
  EXPECT_EQ(log_.count(LogLevel::Error, kS + "Could not tear down Tarvex SAP session!"), 2);
  primitives_->teardownStatus = 0;
  openOrFail();
  EXPECT_EQ(primitives_->events(),
            (std::vector<std::string>{"init:1", "exchange:1", "exchange:1", "teardown:1", "teardown:1", "teardown:1",
                                      "init:2", "exchange:2", "exchange:2"}));
}

// TTL() only reads, while state() closes a session past its expiration. The time-to-live comes
// from the server: none leaves a first open without expiration, and a huge one still gives a sane
// date.
TEST_F(SessionTest, TimeToLive) {
  EXPECT_EQ(session_->TTL(), 0.0);
  EXPECT_EQ(session_->description(), "TarvexSAPSession <state: [Closed], TTL: 0.000000s>");
  delegate_->ttl = std::nullopt;
  openOrFail();
  EXPECT_GT(session_->TTL(), 100.0 * 365 * 24 * 3600);
  const size_t mark = log_.size();
  session_->setTTL(1e300);
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateOpen);
  const std::string line = log_.entries(mark).at(0).message;
  EXPECT_GE(std::stoi(line.substr(line.find("self.expiration: ") + 17, 4)), 2025) << line;
  session_->setTTL(3600);
  EXPECT_TRUE(std::regex_match(session_->description(),
                               std::regex(R"(TarvexSAPSession <state: \[Open\], TTL: 35\d\d\.\d{6}s>)")));
  session_->setTTL(-5);
  EXPECT_LT(session_->TTL(), -4.9);
  EXPECT_EQ(stateInt(), 6u) << "TTL() ran the expiration check";
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);
  EXPECT_EQ(primitives_->count("teardown"), 1);
  EXPECT_EQ(session_->TTL(), 0.0);
}

TEST_F(SessionTest, EmptyCompletionsOpenButSignAndVerifyNothing) {
  session_->openWithCompletionHandler(nullptr);
  for (int i = 0; i < 10 && stateInt() != 6; ++i) flush();
  ASSERT_EQ(stateInt(), 6u);
  session_->setTTL(-1);  // anything that ran would close the session
  session_->signatureForData(Data::fromString("body"), nullptr);
  session_->verifySignature(Data::fromString("RSP(a)"), Data::fromString("a"), nullptr);
  flush();
  EXPECT_EQ(stateInt(), 6u);
  EXPECT_EQ(primitives_->count("sign") + primitives_->count("verify"), 0);
}

TEST_F(SessionTest, WithoutItsDelegateAnOpenNeverCompletesYetDestructionTearsDown) {
  delegate_.reset();  // held weakly
  auto done = startOpen();
  flush();
  flush();
  EXPECT_EQ(done->count(), 0);
  EXPECT_EQ(stateInt(), 2u);
  session_.reset();
  EXPECT_EQ(primitives_->events(), (std::vector<std::string>{"init:1", "teardown:1"}));
}

// The destructor runs wherever the last reference goes: after queued work, or inside a completion.
TEST_F(SessionTest, DestructionWaitsForQueuedWorkAndMayHappenInACompletion) {
  openOrFail();
  platform::Semaphore done;
  auto last = std::make_shared<std::shared_ptr<TarvexSAPSession>>(std::move(session_));
  (*last)->signatureForData(Data::fromString("last words"), [last, &done](auto signature, auto) {
    EXPECT_TRUE(signature);
    last->reset();
    done.signal();
  });
  last.reset();
  ASSERT_TRUE(done.waitFor(kGuard));
  for (int i = 0; i < 500 && primitives_->count("teardown") == 0; ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  EXPECT_EQ(primitives_->events(),
            (std::vector<std::string>{"init:1", "exchange:1", "exchange:1", "sign:1", "teardown:1"}));
}

TEST_F(SessionTest, CompletionsMayUseTheBlockingAccessors) {
  platform::Semaphore done;
  TarvexSAPSessionState seen = TarvexSAPSessionStateClosed;
  session_->openWithCompletionHandler([&, session = session_.get()](std::optional<Error>) {
    seen = session->state();
    session->description();
    session->setTTL(60);
    done.signal();
  });
  ASSERT_TRUE(done.waitFor(kGuard)) << "an accessor deadlocked inside a completion";
  EXPECT_EQ(seen, TarvexSAPSessionStateOpen);
  EXPECT_LE(session_->TTL(), 60.0);
}

TEST(SessionObjectTest, PlainInitIsForbidden) {
  EXPECT_THROW(TarvexSAPSession::init(), platform::InternalInconsistencyException);
}

TEST(SessionErrorTest, EachCodeCarriesItsFixedDescriptionOrNoUserInfo) {
  const std::pair<int64_t, const char*> rows[] = {{-1, "An unknown error has occurred."},
                                                  {-2, "Tarvex is not available on this platform."},
                                                  {-3, "An invalid parameter was provided by the caller."},
                                                  {-4, "An internal error has occurred."},
                                                  {-5, nullptr},
                                                  {-6, nullptr},
                                                  {-7, "Cannot perform this action in the current state."},
                                                  {-8, nullptr},
                                                  {0, nullptr}};
  for (const auto& [code, text] : rows) {
    std::optional<platform::Dictionary> info;
    if (text) info = platform::Dictionary{{platform::LocalizedDescriptionKey, Value(text)}};
    EXPECT_EQ(QVSAPS_errorWithCode(code), Error(TarvexSAPSessionErrorDomain, code, info)) << code;
  }
}

}  // namespace
}  // namespace saptest
