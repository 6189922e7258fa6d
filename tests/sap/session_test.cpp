// The session against faked primitives and delegate: every way an open, a signature and a
// verification end (state, error, log line), closing, expiration, the object's own rules, and what
// only the session owns when several things happen at once.
#include <atomic>
#include <cstring>
#include <deque>
#include <regex>
#include <set>
#include <thread>

#include "common/log_capture.h"
#include "common/rows.h"
#include "platform/dispatch/semaphore.h"
#include "platform/values/exception.h"
#include "sap/tarvex_sap_session.h"

namespace platform {
inline void PrintTo(const Error& error, std::ostream* out) { *out << error.description(); }
}  // namespace platform

namespace {

using platform::Data;
using platform::Error;
using platform::LogLevel;
using platform::Value;
using Events = std::vector<std::string>;
constexpr LogLevel kInfo = LogLevel::Info, kDefault = LogLevel::Default, kError = LogLevel::Error;
constexpr std::chrono::seconds kGuard{10};  // a hang guard only

// One scripted exchange; returnCode nullopt leaves the session's preset, out nullopt gives no buffer.
struct Exchange {
  int32_t status = 0;
  std::optional<uint8_t> returnCode;
  std::optional<std::string> out;
};

// Records each call as "init:1", "exchange:1", ... (the number names the handle) and fails the test
// when the session breaks the call contract. By default a handle's first exchange answers
// "REQ(<input>)" with return code 1 and the second completes with 0; sign answers "SIG(<data>)";
// verify accepts exactly "RSP(<data>)" and then overwrites the data it was given, as it may.
struct FakePrimitives {
  int32_t initStatus = 0, signStatus = 0, verifyStatus = 0, teardownStatus = 0;
  std::optional<Exchange> first, second;
  std::mutex mutex;
  Events events;
  std::set<QVSAPContextOpaque_*> live;
  uintptr_t made = 0;

  Events all() {
    std::lock_guard lock(mutex);
    return events;
  }
  int count(const std::string& prefix) {
    std::lock_guard lock(mutex);
    return static_cast<int>(
        std::count_if(events.begin(), events.end(), [&](const std::string& e) { return e.starts_with(prefix); }));
  }
  std::string record(const char* what, QVSAPContextOpaque_* handle, bool mustBeLive) {
    std::string e = what + (":" + std::to_string(reinterpret_cast<uintptr_t>(handle)));
    if (mustBeLive && !live.count(handle)) ADD_FAILURE() << e << " uses a handle that is not live";
    events.push_back(e);
    return e;
  }
};

std::string text(const uint8_t* bytes, size_t length) {
  return length ? std::string(reinterpret_cast<const char*>(bytes), length) : "";
}
uint8_t* mallocCopy(const std::string& s, uint32_t* length) {
  auto* buffer = static_cast<uint8_t*>(std::malloc(std::max<size_t>(s.size(), 1)));
  std::memcpy(buffer, s.data(), s.size());
  *length = static_cast<uint32_t>(s.size());
  return buffer;
}

TarvexSAPPrimitives fakeTable(std::shared_ptr<FakePrimitives> p) {
  return {[p](QVSAPContextOpaque_** context, TarvexHWInfo_*) {
            std::lock_guard lock(p->mutex);
            if (p->initStatus != 0) return p->initStatus;
            *context = reinterpret_cast<QVSAPContextOpaque_*>(++p->made);  // a token, never dereferenced
            p->live.insert(*context);
            p->record("init", *context, true);
            return 0;
          },
          [p](int32_t selector, TarvexHWInfo_*, QVSAPContextOpaque_* context, const uint8_t* in, size_t inLength,
              uint8_t** out, uint32_t* outLength, uint8_t* returnCode) {
            EXPECT_EQ(selector, kTarvexSAPExchangeSelector);
            EXPECT_TRUE(*out == nullptr && *outLength == 0 && *returnCode == 255)
                << "outputs must start null, 0 and 255";
            std::lock_guard lock(p->mutex);
            const std::string e = p->record("exchange", context, true);
            const Exchange reply = std::count(p->events.begin(), p->events.end(), e) == 1
                                       ? p->first.value_or(Exchange{0, 1, "REQ(" + text(in, inLength) + ")"})
                                       : p->second.value_or(Exchange{0, 0, std::nullopt});
            if (reply.out) *out = mallocCopy(*reply.out, outLength);
            if (reply.returnCode) *returnCode = *reply.returnCode;
            return reply.status;
          },
          [p](QVSAPContextOpaque_* context, const uint8_t* data, size_t length, uint8_t** signature,
              uint32_t* signatureLength) {
            EXPECT_TRUE(*signature == nullptr && *signatureLength == 0) << "outputs must start null and 0";
            std::lock_guard lock(p->mutex);
            p->record("sign", context, true);
            // Even on failure: the session frees it either way.
            *signature = mallocCopy("SIG(" + text(data, length) + ")", signatureLength);
            return p->signStatus;
          },
          [p](QVSAPContextOpaque_* context, const uint8_t* signature, size_t signatureLength, uint8_t* data,
              size_t length) {
            std::lock_guard lock(p->mutex);
            p->record("verify", context, true);
            const bool valid = text(signature, signatureLength) == "RSP(" + text(data, length) + ")";
            if (length) std::memset(data, 'X', length);
            return valid ? p->verifyStatus : -6;
          },
          [p](QVSAPContextOpaque_* context) {
            std::lock_guard lock(p->mutex);
            p->record("teardown", context, false);  // a dead handle is refused harmlessly, as the library does
            p->live.erase(context);
            return p->teardownStatus;
          }};
}

struct Answer {
  std::optional<Data> data = std::nullopt;
  std::optional<Error> error = std::nullopt;
};

// Answers each leg with its script, `calls` times (a misbehaving delegate calls twice), the
// handshake after setting `ttl` on the session as the transport does; a leg scripted nullopt is
// held until released.
struct FakeDelegate : TarvexSAPSessionDelegate {
  std::optional<Answer> certificate = Answer{Data::fromString("CERT")}, handshake = Answer{Data::fromString("INFO")};
  int calls = 1;
  std::optional<double> ttl = 3600.0;
  std::mutex mutex;
  std::deque<TarvexSAPDataCompletion> waiting;
  platform::Semaphore held;

  bool waitHeld() { return held.waitFor(kGuard); }
  void release(const Answer& answer) {  // the oldest held request
    std::unique_lock lock(mutex);
    ASSERT_FALSE(waiting.empty()) << "no request is held";
    TarvexSAPDataCompletion completion = std::move(waiting.front());
    waiting.pop_front();
    lock.unlock();
    completion(answer.data, answer.error);
  }
  void answer(const std::optional<Answer>& script, TarvexSAPDataCompletion completion) {
    std::unique_lock lock(mutex);
    if (!script) return waiting.push_back(std::move(completion)), held.signal();
    lock.unlock();
    for (int i = 0; i < calls; ++i) completion(script->data, script->error);
  }
  void sessionRequestCertificateWithCompletionHandler(TarvexSAPSession&, TarvexSAPDataCompletion completion) override {
    answer(certificate, std::move(completion));
  }
  void sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session, const std::optional<Data>&,
                                                          TarvexSAPDataCompletion completion) override {
    if (ttl) session.setTTL(*ttl);
    answer(handshake, std::move(completion));
  }
};

// A completion that records its first call's arguments, how many calls came, and whether any ran
// off `queue`.
template <class... A>
struct Recorder : std::enable_shared_from_this<Recorder<A...>> {
  std::atomic<int> calls{0};
  std::atomic<bool> offQueue{false};
  std::optional<std::tuple<A...>> first;  // written by the first call alone, before `done` is signalled
  platform::Semaphore done;

  std::function<void(A...)> handler(std::shared_ptr<platform::Queue> queue) {
    return [self = this->shared_from_this(), queue](A... args) {
      if (!queue->isCurrent()) self->offQueue = true;
      if (self->calls++ == 0) self->first.emplace(std::move(args)...), self->done.signal();
    };
  }
  std::optional<std::tuple<A...>> wait() {  // nullopt, and a test failure, when none came in time
    if (done.waitFor(kGuard)) return first;
    ADD_FAILURE() << "no completion";
    return std::nullopt;
  }
  int count() { return calls; }
};
using OpenRecorder = Recorder<std::optional<Error>>;
using SignRecorder = Recorder<std::optional<Data>, std::optional<Error>>;
using VerifyRecorder = Recorder<bool, std::optional<Error>>;
const Error kNoCompletion("test", 0);

class SessionTest : public ::testing::Test {
 protected:
  void TearDown() override {
    std::deque<TarvexSAPDataCompletion> dropped;  // held completions keep the session alive
    if (delegate_) {
      std::lock_guard lock(delegate_->mutex);
      dropped.swap(delegate_->waiting);
    }
    if (session_) flush();
    session_.reset();
  }

  // Makes the call, waits for its completion and checks that it came once, on the completion queue.
  template <class... A, class Start>
  std::tuple<A...> settle(Start start, std::tuple<A...> none) {
    auto done = std::make_shared<Recorder<A...>>();
    start(done->handler(session_->completionQueue()));
    auto result = done->wait();
    flush();
    EXPECT_EQ(done->count(), 1);
    EXPECT_FALSE(done->offQueue) << "a completion ran off the completion queue";
    return result.value_or(none);
  }
  std::optional<Error> open() {
    return std::get<0>(
        settle([&](auto h) { session_->openWithCompletionHandler(h); }, std::tuple(std::optional(kNoCompletion))));
  }
  std::tuple<std::optional<Data>, std::optional<Error>> sign(const std::optional<Value>& data) {
    return settle([&](auto h) { session_->signatureForData(data, h); },
                  std::tuple(std::optional<Data>(), std::optional(kNoCompletion)));
  }
  std::tuple<bool, std::optional<Error>> verify(const std::optional<Value>& signature,
                                                const std::optional<Value>& data) {
    return settle([&](auto h) { session_->verifySignature(signature, data, h); },
                  std::tuple(false, std::optional(kNoCompletion)));
  }
  void openOrFail() {
    ASSERT_EQ(open(), std::nullopt);
    ASSERT_EQ(stateInt(), 6u);
  }
  std::shared_ptr<OpenRecorder> startOpen() {  // without waiting
    auto done = std::make_shared<OpenRecorder>();
    session_->openWithCompletionHandler(done->handler(session_->completionQueue()));
    return done;
  }
  uint64_t stateInt() {  // read on the internal queue, with no expiration check
    uint64_t value = 99;
    session_->internalQueue()->sync([&] { value = session_->state_int(); });
    return value;
  }
  void flush() {  // twice: work hops from one queue to another
    for (int round = 0; round < 2; ++round) {
      session_->delegateQueue()->barrierSync([] {});
      session_->internalQueue()->sync([] {});
      session_->completionQueue()->barrierSync([] {});
    }
  }

  zlkatest::LogCapture log_;
  std::shared_ptr<FakePrimitives> primitives_ = std::make_shared<FakePrimitives>();
  std::shared_ptr<FakeDelegate> delegate_ = std::make_shared<FakeDelegate>();
  std::shared_ptr<TarvexSAPSession> session_ = TarvexSAPSession::sessionWithDelegate(delegate_, fakeTable(primitives_));
};

const Error kTransport("SomeTransportDomain", -5, platform::Dictionary{{"NSUnderlying", Value("refused")}});
const Error kInvalid = QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidParameter);
const Error kInternal = QVSAPS_errorWithCode(TarvexSAPSessionErrorInternal);
const Error kInvalidState = QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState);
const Error kSignOnlyOpen =
    QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState, "Session must be open to generate signature.");
const Error kVerifyOnlyOpen =
    QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState, "Session must be open to verify signature.");
const std::string kS = "[#TarvexSAPSession] ";
const std::string kNoRequest = kS + "Could not generate handshake request data! (status: ";
const std::string kNoAnswer = kS + "Could not process handshake response! (status: ";
const std::string kCertificateError = kS + "Error requesting certificate: " + kTransport.description();

struct OpenRow {
  const char* name;
  struct {  // what differs from the fakes' defaults
    int32_t initStatus = 0;
    std::optional<Answer> certificate = std::nullopt, handshake = std::nullopt;
    std::optional<Exchange> first = std::nullopt, second = std::nullopt;
    int calls = 1;  // how often the delegate calls each completion
  } script;
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
  {"HandshakeErrorPassesThrough", {.handshake = Answer{std::nullopt, kTransport}}, kTransport, 1, kError, kS + "Error requesting handshake: " + kTransport.description()},
  {"NoHandshakeAnswer", {.handshake = Answer{}}, kInvalid, 1, kDefault, kS + "Invalid handshake response received!"},
  // Empty is still an answer: the primitive judges it.
  {"EmptyHandshakeAnswer", {.handshake = Answer{Data()}}, std::nullopt, 0, kInfo, kS + "Received handshake response!"},
  // One round trip only: a primitive that wants another round has failed.
  {"AnotherRoundWanted", {.second = Exchange{0, 1, "ROUND2"}}, kInternal, 1, kError, kNoAnswer + "0, returnCode: 1)"},
  {"AnswerStatusFails", {.second = Exchange{-5, 0, "JUNK"}}, kInternal, 1, kError, kNoAnswer + "-5, returnCode: 0)"},
  {"AnswerWithoutReturnCode", {.second = Exchange{0, std::nullopt, std::nullopt}}, kInternal, 1, kError, kNoAnswer + "0, returnCode: 255)"},
  {"UnreadOutputAfterTheAnswer", {.second = Exchange{0, 0, "EXTRA"}}, std::nullopt, 0, kInfo, kS + "self.state_int: [Open]"},
  // A delegate that calls a completion twice is heard once, whether the open succeeds or fails.
  {"DelegateAnsweringTwice", {.calls = 2}, std::nullopt, 0, kInfo, kS + "self.state_int: [Open]"},
  {"DelegateFailingTwice", {.certificate = Answer{std::nullopt, kTransport}, .calls = 2}, kTransport, 1, kError, kCertificateError},
};
// clang-format on

class OpenTest : public SessionTest, public ::testing::WithParamInterface<OpenRow> {};

TEST_P(OpenTest, EndsInItsStateWithItsErrorAndLine) {
  const auto& [name, script, error, teardowns, level, line] = GetParam();
  primitives_->initStatus = script.initStatus;
  primitives_->first = script.first;
  primitives_->second = script.second;
  if (script.certificate) delegate_->certificate = script.certificate;
  if (script.handshake) delegate_->handshake = script.handshake;
  delegate_->calls = script.calls;
  EXPECT_EQ(open(), error);
  EXPECT_EQ(stateInt(), error ? 0u : 6u);
  EXPECT_EQ(primitives_->count("teardown"), teardowns);
  EXPECT_EQ(log_.count(level, line), 1) << log_.dump();
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
  {"SigningNothingIsInvalid", Closed, false, std::nullopt, {}, 0, false, kInvalid, 0, kInfo, kS + "Invalid parameter! (data.class: (null), data: (null))"},
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
  if (row.before >= Open) {
    ASSERT_NO_FATAL_FAILURE(openOrFail());
  }
  if (row.before == Expired) session_->setTTL(-1);
  primitives_->signStatus = primitives_->verifyStatus = row.status;
  const size_t mark = log_.size();
  // Data shares its bytes between copies: only text taken before shows a write into them.
  auto data = [&] { return row.second && row.second->data() ? std::string(row.second->data()->view()) : ""; };
  const std::string before = data();
  const auto [ok, error] = row.verify ? verify(row.first, row.second) : [&] {
    auto [signature, error] = sign(row.first);
    return std::tuple(signature == Data::fromString("SIG(body)"), error);
  }();
  EXPECT_EQ(ok, !row.error);
  EXPECT_EQ(error, row.error);
  EXPECT_EQ(data(), before) << "the primitive wrote into the caller's data";
  EXPECT_EQ(stateInt(), row.stateAfter);
  EXPECT_EQ(primitives_->count(row.verify ? "verify" : "sign"), row.reachesPrimitive ? 1 : 0);
  EXPECT_EQ(log_.count(row.level, row.line, mark), 1) << log_.dump();
}

ZLKA_ROWS(UseTest, UseRow, kUses);

TEST_F(SessionTest, OpensThroughEveryStateInOrder) {
  openOrFail();
  std::string states;
  for (const auto& e : log_.entries())
    if (e.level == kInfo && e.message.starts_with(kS + "self.state_int: ")) states += e.message.substr(kS.size() + 16);
  EXPECT_EQ(states,
            "[Initialized][Waiting For Certificate][Generating Handshake Request][Waiting For Handshake Response]"
            "[Processing Handshake Response][Open]");
}

// A close keeps the handle: every later close, and the next open's expiration check, tear it
// down again (the primitives refuse a dead handle harmlessly).
TEST_F(SessionTest, ClosingTearsTheContextDownAndLogsAFailedTeardown) {
  session_->close();
  flush();
  EXPECT_TRUE(primitives_->all().empty());
  EXPECT_EQ(log_.count(kDefault, kS + "Closing session..."), 1);
  openOrFail();
  primitives_->teardownStatus = -3;
  session_->close();
  session_->close();
  EXPECT_EQ(stateInt(), 0u);
  EXPECT_EQ(log_.count(kError, kS + "Could not tear down Tarvex SAP session!"), 2);
  primitives_->teardownStatus = 0;
  openOrFail();
  EXPECT_EQ(primitives_->all(), (Events{"init:1", "exchange:1", "exchange:1", "teardown:1", "teardown:1", "teardown:1",
                                        "init:2", "exchange:2", "exchange:2"}));
}

// TTL() only reads, while state() closes a session past its expiration. The time-to-live comes
// from the server: none leaves a first open without expiration, and a huge one still gives a sane
// date.
TEST_F(SessionTest, TimeToLive) {
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
  EXPECT_EQ(done->count(), 0);
  EXPECT_EQ(stateInt(), 2u);
  session_.reset();
  EXPECT_EQ(primitives_->all(), (Events{"init:1", "teardown:1"}));
}

// The destructor runs wherever the last reference goes: after queued work, or inside a completion
// whose accessors must not deadlock either.
TEST_F(SessionTest, DestructionWaitsForQueuedWorkAndMayHappenInACompletion) {
  openOrFail();
  platform::Semaphore done;
  auto last = std::make_shared<std::shared_ptr<TarvexSAPSession>>(std::move(session_));
  (*last)->signatureForData(Data::fromString("last words"), [last, &done](auto signature, auto) {
    EXPECT_TRUE(signature);
    EXPECT_EQ((*last)->state(), TarvexSAPSessionStateOpen);
    (*last)->setTTL(60);
    (*last)->description();
    last->reset();
    done.signal();
  });
  last.reset();
  ASSERT_TRUE(done.waitFor(kGuard)) << "an accessor deadlocked inside a completion";
  for (int i = 0; i < 500 && primitives_->count("teardown") == 0; ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  EXPECT_EQ(primitives_->all(), (Events{"init:1", "exchange:1", "exchange:1", "sign:1", "teardown:1"}));
}

TEST(SessionObjectTest, PlainInitIsForbiddenAndEachErrorCodeCarriesItsFixedDescription) {
  EXPECT_THROW(TarvexSAPSession::init(), platform::InternalInconsistencyException);
  // clang-format off
  const std::pair<int64_t, const char*> rows[] = {
      {-1, "An unknown error has occurred."}, {-2, "Tarvex is not available on this platform."},
      {-3, "An invalid parameter was provided by the caller."}, {-4, "An internal error has occurred."},
      {-5, nullptr}, {-6, nullptr}, {-7, "Cannot perform this action in the current state."}, {-8, nullptr}, {0, nullptr}};
  // clang-format on
  for (const auto& [code, text] : rows) {
    std::optional<platform::Dictionary> info;
    if (text) info = platform::Dictionary{{platform::LocalizedDescriptionKey, Value(text)}};
    EXPECT_EQ(QVSAPS_errorWithCode(code), Error(TarvexSAPSessionErrorDomain, code, info)) << code;
  }
}

// A late answer to an open that was closed and replaced by a newer one completes with the
// invalid-state error and touches nothing: no primitive call, no state change, no log line.
TEST_F(SessionTest, AStaleAnswerTouchesNothing) {
  delegate_->certificate = std::nullopt;
  auto stale = startOpen();
  ASSERT_TRUE(delegate_->waitHeld());
  session_->close();
  auto current = startOpen();
  ASSERT_TRUE(delegate_->waitHeld());
  flush();
  const Events events = primitives_->all();
  const size_t mark = log_.size();
  delegate_->release({Data::fromString("STALE")});
  EXPECT_EQ(stale->wait(), std::tuple(std::optional(kInvalidState)));
  flush();
  EXPECT_EQ(primitives_->all(), events);
  EXPECT_EQ(stateInt(), 2u);
  EXPECT_EQ(log_.countStartingWith("[#TarvexSAPSession]", mark), 0) << log_.dump();
  delegate_->release({Data::fromString("CERT")});
  EXPECT_EQ(current->wait(), std::tuple(std::optional<Error>()));
  EXPECT_EQ(stale->count(), 1);
}

// A reopened session keeps the past expiration of its last close until the handshake answer sets
// a new one: nothing that runs meanwhile may tear down the context the open is using.
TEST_F(SessionTest, AnOpeningSessionNeverExpires) {
  openOrFail();
  session_->close();
  delegate_->ttl = std::nullopt;
  delegate_->certificate = delegate_->handshake = std::nullopt;
  auto reopened = startOpen();
  for (const char* answer : {"CERT", "INFO"}) {
    ASSERT_TRUE(delegate_->waitHeld());
    EXPECT_EQ(session_->state(), TarvexSAPSessionStateInitializing);
    EXPECT_EQ(std::get<1>(sign(kBody)), kSignOnlyOpen);
    delegate_->release({Data::fromString(answer)});
  }
  EXPECT_EQ(reopened->wait(), std::tuple(std::optional<Error>()));
  EXPECT_EQ(primitives_->all(), (Events{"init:1", "exchange:1", "exchange:1", "teardown:1", "teardown:1", "init:2",
                                        "exchange:2", "exchange:2"}));
  EXPECT_EQ(session_->state(), TarvexSAPSessionStateClosed);  // open now, with the old expiration: the check closes it
}

// Opens racing from eight threads: exactly one goes through; the others, and an open of an open
// session, are refused and change nothing.
TEST_F(SessionTest, OnlyOneOpenGoesThrough) {
  const Error refused =
      QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState, "Session is already open or initializing.");
  delegate_->certificate = std::nullopt;  // the winner stays opening until every other open has answered
  std::vector<std::shared_ptr<OpenRecorder>> opens(8);
  std::vector<std::thread> threads;
  for (auto& racer : opens) threads.emplace_back([&racer, this] { racer = startOpen(); });
  for (auto& t : threads) t.join();
  ASSERT_TRUE(delegate_->waitHeld());
  delegate_->release({Data::fromString("CERT")});
  int opened = 0;
  for (auto& racer : opens) {
    const auto error = std::get<0>(racer->wait().value_or(std::tuple(std::optional(kNoCompletion))));
    opened += !error;
    EXPECT_EQ(error.value_or(refused), refused);
  }
  flush();
  EXPECT_EQ(opened, 1);
  for (auto& racer : opens) EXPECT_EQ(racer->count(), 1);
  EXPECT_EQ(open(), refused);
  EXPECT_EQ(primitives_->all(), (Events{"init:1", "exchange:1", "exchange:1"}));
}

// Opens, closes, expirations, signatures, verifications and reads from four threads: every
// completion comes exactly once, and no primitive call uses a torn-down context (the fake fails
// the test if one does).
TEST_F(SessionTest, MixedCallsFromManyThreads) {
  std::mutex mutex;
  std::vector<std::pair<std::function<bool()>, std::function<int()>>> pending;  // wait, count
  auto keep = [&](auto recorder) {
    std::lock_guard lock(mutex);
    pending.emplace_back([recorder] { return recorder->wait().has_value(); }, [recorder] { return recorder->count(); });
    return recorder->handler(session_->completionQueue());
  };
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int round = 0; round < 150; ++round) {
        const int kind = (round + t) % 6;
        if (kind == 0) session_->openWithCompletionHandler(keep(std::make_shared<OpenRecorder>()));
        if (kind == 1) session_->signatureForData(Data::fromString("b"), keep(std::make_shared<SignRecorder>()));
        if (kind == 2)
          session_->verifySignature(Data::fromString("RSP(b)"), Data::fromString("b"),
                                    keep(std::make_shared<VerifyRecorder>()));
        if (kind == 3) round % 3 ? session_->setTTL(round % 2 ? 3600.0 : -1.0) : session_->close();
        if (kind > 3) session_->description();
      }
    });
  }
  for (auto& t : threads) t.join();
  for (auto& [wait, count] : pending) {
    ASSERT_TRUE(wait());
  }
  flush();
  for (auto& [wait, count] : pending) EXPECT_EQ(count(), 1);
}

}  // namespace
