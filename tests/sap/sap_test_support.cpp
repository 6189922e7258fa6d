#include "sap_test_support.h"

#include <cstdlib>
#include <cstring>

namespace saptest {

namespace {

constexpr char kPrefix[] = "[#TarvexSAPSession] ";

// Handles are tokens, never dereferenced; distinct, non-null and recognisable in failures.
QVSAPContextOpaque_* handleNumbered(int n) {
  return reinterpret_cast<QVSAPContextOpaque_*>(static_cast<uintptr_t>(0x5A0000 + 0x10 * n));
}

}  // namespace

Data dataOf(std::string_view text) { return Data::fromString(text); }

std::string textOf(const Data& data) { return std::string(data.view()); }

std::string textOf(const uint8_t* bytes, size_t length) {
  return length == 0 ? std::string() : std::string(reinterpret_cast<const char*>(bytes), length);
}

uint8_t* mallocCopy(std::string_view text) {
  auto* buffer = static_cast<uint8_t*>(std::malloc(text.empty() ? 1 : text.size()));
  if (!text.empty()) std::memcpy(buffer, text.data(), text.size());
  return buffer;
}

void expectSessionError(const std::optional<Error>& error, int64_t code, const std::optional<std::string>& description) {
  ASSERT_TRUE(error.has_value()) << "expected error " << code;
  EXPECT_EQ(error->domain(), TarvexSAPSessionErrorDomain);
  EXPECT_EQ(error->code(), code);
  if (description) {
    ASSERT_TRUE(error->userInfo().has_value()) << error->description();
    const auto it = error->userInfo()->find(platform::LocalizedDescriptionKey);
    ASSERT_NE(it, error->userInfo()->end()) << error->description();
    ASSERT_NE(it->second.string(), nullptr);
    EXPECT_EQ(*it->second.string(), *description);
    EXPECT_EQ(error->userInfo()->size(), 1u);
  } else {
    EXPECT_FALSE(error->userInfo().has_value()) << error->description();
  }
}

std::optional<Error> openSession(TarvexSAPSession& session) {
  auto done = std::make_shared<OpenRecorder>();
  session.openWithCompletionHandler(done->handler());
  if (!done->wait()) {
    ADD_FAILURE() << "open never completed";
    return Error("test", 0);
  }
  return std::get<0>(done->result());
}

std::pair<std::optional<Data>, std::optional<Error>> signWith(TarvexSAPSession& session,
                                                              const std::optional<platform::Value>& data) {
  auto done = std::make_shared<SignRecorder>();
  session.signatureForData(data, done->handler());
  if (!done->wait()) {
    ADD_FAILURE() << "signing never completed";
    return {std::nullopt, Error("test", 0)};
  }
  auto [signature, error] = done->result();
  return {signature, error};
}

std::pair<bool, std::optional<Error>> verifyWith(TarvexSAPSession& session, const std::optional<platform::Value>& signature,
                                                 const std::optional<platform::Value>& data) {
  auto done = std::make_shared<VerifyRecorder>();
  session.verifySignature(signature, data, done->handler());
  if (!done->wait()) {
    ADD_FAILURE() << "verification never completed";
    return {false, Error("test", 0)};
  }
  auto [valid, error] = done->result();
  return {valid, error};
}

void flushQueues(TarvexSAPSession& session) {
  for (int round = 0; round < 2; ++round) {
    session.delegateQueue()->barrierSync([] {});
    session.internalQueue()->sync([] {});
    session.completionQueue()->barrierSync([] {});
  }
}

void releaseSession(std::shared_ptr<TarvexSAPSession>& session, LifetimeProbe& lifetime) {
  if (!session) return;
  flushQueues(*session);
  EXPECT_EQ(session.use_count(), 1) << "something still holds the session";
  session.reset();
  ASSERT_TRUE(lifetime.waitGone()) << "the session was never destroyed";
}

// ---- LogCapture

LogCapture::LogCapture() : previous_(platform::currentLogSettings()) {
  platform::LogSettings settings = previous_;
  settings.minimum = platform::LogLevel::Debug;
  settings.backend = platform::LogBackend::Stderr;
  platform::configureLog(settings);
  platform::setLogSink([store = store_](const platform::LogEntry& entry) {
    std::lock_guard lock(store->mutex);
    store->entries.push_back(entry);
  });
}

LogCapture::~LogCapture() {
  platform::setLogSink({});
  platform::configureLog(previous_);
}

std::vector<platform::LogEntry> LogCapture::entries() const {
  std::lock_guard lock(store_->mutex);
  return store_->entries;
}

std::vector<std::string> LogCapture::lines() const {
  std::vector<std::string> out;
  for (const auto& e : entries())
    if (e.message.rfind(kPrefix, 0) == 0) out.push_back(e.message);
  return out;
}

int LogCapture::count(platform::LogLevel level, std::string_view line) const {
  int n = 0;
  for (const auto& e : entries())
    if (e.level == level && e.message == line) ++n;
  return n;
}

int LogCapture::countStartingWith(std::string_view prefix) const {
  int n = 0;
  for (const auto& e : entries())
    if (e.message.rfind(prefix, 0) == 0) ++n;
  return n;
}

void LogCapture::clear() {
  std::lock_guard lock(store_->mutex);
  store_->entries.clear();
}

// ---- LifetimeProbe

std::shared_ptr<void> LifetimeProbe::token() {
  auto gone = gone_;
  return std::shared_ptr<void>(nullptr, [gone](void*) { gone->signal(); });
}

bool LifetimeProbe::waitGone(std::chrono::nanoseconds timeout) { return gone_->waitFor(timeout); }

// ---- FakeLayer

TarvexSAPPrimitives FakeLayer::primitives(std::shared_ptr<void> lifetimeToken) {
  // The table keeps the layer, and the probe's token, alive for as long as the session keeps it.
  auto self = shared_from_this();
  TarvexSAPPrimitives p;
  p.init = [self, lifetimeToken](QVSAPContextOpaque_** c, TarvexHWInfo_* hw) { return self->init(c, hw); };
  p.exchange = [self](int32_t selector, TarvexHWInfo_* hw, QVSAPContextOpaque_* c, const uint8_t* in, size_t inLength,
                      uint8_t** out, uint32_t* outLength, uint8_t* rc) {
    return self->exchange(selector, hw, c, in, inLength, out, outLength, rc);
  };
  p.sign = [self](QVSAPContextOpaque_* c, const uint8_t* d, size_t n, uint8_t** s, uint32_t* sn) {
    return self->sign(c, d, n, s, sn);
  };
  p.verify = [self](QVSAPContextOpaque_* c, const uint8_t* s, size_t sn, uint8_t* d, size_t n) {
    return self->verify(c, s, sn, d, n);
  };
  p.teardown = [self](QVSAPContextOpaque_* c) { return self->teardown(c); };
  return p;
}

int32_t FakeLayer::init(QVSAPContextOpaque_** context, TarvexHWInfo_* hwInfo) {
  std::lock_guard lock(mutex_);
  ++initCalls_;
  initHwInfos_.push_back(hwInfo);
  initHwSnapshots_.push_back(*hwInfo);
  events_.push_back("init");
  if (initStatus != 0) return initStatus;
  QVSAPContextOpaque_* handle = handleNumbered(static_cast<int>(handles_.size()) + 1);
  handles_.push_back(handle);
  live_.insert(handle);
  *context = handle;
  events_.back() += ":" + std::to_string(handles_.size());
  if (hwInfo->IDLength == 0) {
    hwInfo->IDLength = 4;
    std::memcpy(hwInfo->ID, "HWID", 4);
  }
  return 0;
}

int32_t FakeLayer::exchange(int32_t selector, TarvexHWInfo_* hwInfo, QVSAPContextOpaque_* context, const uint8_t* in,
                            size_t inLength, uint8_t** out, uint32_t* outLength, uint8_t* returnCode) {
  const bool presets = *out == nullptr && *outLength == 0 && *returnCode == 255;
  const std::string input = textOf(in, inLength);
  std::function<std::optional<ExchangeReply>(int, const std::string&)> script;
  int step;
  {
    std::lock_guard lock(mutex_);
    step = ++steps_[context];
    script = exchangeScript;
  }
  std::optional<ExchangeReply> reply = script ? script(step, input) : std::nullopt;
  if (!reply) {
    reply.emplace();
    if (step == 1) {
      reply->returnCode = 1;
      reply->out = "REQUEST(" + input + ")";
    } else {
      reply->returnCode = 0;
    }
  }
  if (reply->out) {
    *out = mallocCopy(*reply->out);
    *outLength = static_cast<uint32_t>(reply->out->size());
  }
  if (reply->returnCode) *returnCode = *reply->returnCode;
  std::lock_guard lock(mutex_);
  exchanges_.push_back({selector, hwInfo, context, input, presets, *out});
  events_.push_back("exchange:" + std::to_string(numberLocked(context)));
  if (!live_.count(context)) deadHandleUses_.push_back(events_.back());
  return reply->status;
}

int32_t FakeLayer::sign(QVSAPContextOpaque_* context, const uint8_t* data, size_t length, uint8_t** signature,
                        uint32_t* signatureLength) {
  std::lock_guard lock(mutex_);
  const bool presets = *signature == nullptr && *signatureLength == 0;
  const std::string text = textOf(data, length);
  if (signStatus == 0 || signReturnsBufferOnFailure) {
    const std::string sig = "SIG(" + text + ")";
    *signature = mallocCopy(sig);
    *signatureLength = static_cast<uint32_t>(sig.size());
  }
  signs_.push_back({context, text, presets, *signature});
  events_.push_back("sign:" + std::to_string(numberLocked(context)));
  if (!live_.count(context)) deadHandleUses_.push_back(events_.back());
  return signStatus;
}

int32_t FakeLayer::verify(QVSAPContextOpaque_* context, const uint8_t* signature, size_t signatureLength, uint8_t* data,
                          size_t length) {
  std::lock_guard lock(mutex_);
  const std::string text = textOf(data, length);
  verifies_.push_back({context, textOf(signature, signatureLength), text, data});
  events_.push_back("verify:" + std::to_string(numberLocked(context)));
  if (!live_.count(context)) deadHandleUses_.push_back(events_.back());
  if (verifyScribbles && length > 0) std::memset(data, 'X', length);
  if (verifies_.back().signature != "RSP(" + text + ")") return -6;
  return verifyStatus;
}

int32_t FakeLayer::teardown(QVSAPContextOpaque_* context) {
  std::lock_guard lock(mutex_);
  teardowns_.push_back(context);
  events_.push_back("teardown:" + std::to_string(numberLocked(context)));
  live_.erase(context);
  return teardownStatus;
}

int FakeLayer::number(QVSAPContextOpaque_* handle) const {
  std::lock_guard lock(mutex_);
  return numberLocked(handle);
}

int FakeLayer::numberLocked(QVSAPContextOpaque_* handle) const {
  for (size_t i = 0; i < handles_.size(); ++i)
    if (handles_[i] == handle) return static_cast<int>(i) + 1;
  return 0;
}

int FakeLayer::initCalls() const {
  std::lock_guard lock(mutex_);
  return initCalls_;
}
std::vector<QVSAPContextOpaque_*> FakeLayer::handles() const {
  std::lock_guard lock(mutex_);
  return handles_;
}
std::vector<TarvexHWInfo_*> FakeLayer::initHwInfos() const {
  std::lock_guard lock(mutex_);
  return initHwInfos_;
}
std::vector<TarvexHWInfo_> FakeLayer::initHwSnapshots() const {
  std::lock_guard lock(mutex_);
  return initHwSnapshots_;
}
std::vector<FakeLayer::ExchangeCall> FakeLayer::exchanges() const {
  std::lock_guard lock(mutex_);
  return exchanges_;
}
std::vector<FakeLayer::SignCall> FakeLayer::signs() const {
  std::lock_guard lock(mutex_);
  return signs_;
}
std::vector<FakeLayer::VerifyCall> FakeLayer::verifies() const {
  std::lock_guard lock(mutex_);
  return verifies_;
}
std::vector<QVSAPContextOpaque_*> FakeLayer::teardowns() const {
  std::lock_guard lock(mutex_);
  return teardowns_;
}
std::vector<std::string> FakeLayer::deadHandleUses() const {
  std::lock_guard lock(mutex_);
  return deadHandleUses_;
}
std::vector<std::string> FakeLayer::events() const {
  std::lock_guard lock(mutex_);
  return events_;
}

// ---- ScriptedDelegate

void ScriptedDelegate::Slot::hold() {
  std::lock_guard lock(mutex_);
  hold_ = true;
}

void ScriptedDelegate::Slot::answerWith(Answer answer) {
  std::lock_guard lock(mutex_);
  hold_ = false;
  answer_ = std::move(answer);
}

void ScriptedDelegate::Slot::answerTwice() {
  std::lock_guard lock(mutex_);
  answerCalls_ = 2;
}

int ScriptedDelegate::Slot::asks() const {
  std::lock_guard lock(mutex_);
  return asks_;
}

bool ScriptedDelegate::Slot::onDelegateQueue() const {
  std::lock_guard lock(mutex_);
  return onDelegateQueue_;
}

void ScriptedDelegate::Slot::ask(TarvexSAPSession& session, TarvexSAPDataCompletion completion) {
  Answer answer;
  int calls;
  {
    std::lock_guard lock(mutex_);
    ++asks_;
    onDelegateQueue_ = onDelegateQueue_ && session.delegateQueue()->isCurrent();
    if (hold_) {
      held_.push_back(std::move(completion));
      heldSignal_.signal();
      return;
    }
    answer = answer_;
    calls = answerCalls_;
  }
  for (int i = 0; i < calls; ++i) completion(answer.data, answer.error);
}

void ScriptedDelegate::Slot::release(Answer answer, int calls) {
  TarvexSAPDataCompletion completion;
  {
    std::lock_guard lock(mutex_);
    ASSERT_FALSE(held_.empty()) << "no request is held";
    completion = std::move(held_.front());
    held_.erase(held_.begin());
  }
  for (int i = 0; i < calls; ++i) completion(answer.data, answer.error);
}

void ScriptedDelegate::Slot::dropHeld() {
  std::vector<TarvexSAPDataCompletion> held;
  {
    std::lock_guard lock(mutex_);
    held.swap(held_);
  }
}

ScriptedDelegate::ScriptedDelegate() {
  certificate.answerWith({dataOf("CERT"), std::nullopt});
  handshake.answerWith({dataOf("INFO"), std::nullopt});
}

ScriptedDelegate::~ScriptedDelegate() = default;

void ScriptedDelegate::sessionRequestCertificateWithCompletionHandler(TarvexSAPSession& session,
                                                                      TarvexSAPDataCompletion completion) {
  certificate.ask(session, std::move(completion));
}

void ScriptedDelegate::sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session,
                                                                          const std::optional<Data>& handshakeData,
                                                                          TarvexSAPDataCompletion completion) {
  std::optional<double> ttl;
  {
    std::lock_guard lock(mutex_);
    requests_.push_back(handshakeData);
    ttl = ttl_;
  }
  if (ttl) session.setTTL(*ttl);
  handshake.ask(session, std::move(completion));
}

// ---- SessionTest

void SessionTest::SetUp() {
  layer_ = std::make_shared<FakeLayer>();
  delegate_ = std::make_shared<ScriptedDelegate>();
  log_ = std::make_unique<LogCapture>();
  session_ = makeSession();
}

std::shared_ptr<TarvexSAPSession> SessionTest::makeSession() {
  lifetime_ = std::make_unique<LifetimeProbe>();
  return TarvexSAPSession::sessionWithDelegate(delegate_, layer_->primitives(lifetime_->token()));
}

void SessionTest::destroySession() {
  if (!session_) return;
  // Held completions keep the session alive; a test that holds one and never answers drops it.
  if (delegate_) {
    delegate_->certificate.dropHeld();
    delegate_->handshake.dropHeld();
  }
  releaseSession(session_, *lifetime_);
}

void SessionTest::TearDown() {
  destroySession();
  log_.reset();
}

std::optional<Error> SessionTest::open() { return openSession(*session_); }

void SessionTest::openOrFail() {
  const auto error = open();
  ASSERT_FALSE(error.has_value()) << error->description();
  ASSERT_EQ(stateInt(), 6u);
}

std::pair<std::optional<Data>, std::optional<Error>> SessionTest::sign(const std::optional<platform::Value>& data) {
  return signWith(*session_, data);
}

std::pair<bool, std::optional<Error>> SessionTest::verify(const std::optional<platform::Value>& signature,
                                                          const std::optional<platform::Value>& data) {
  return verifyWith(*session_, signature, data);
}

uint64_t SessionTest::stateInt() {
  uint64_t value = 99;
  session_->internalQueue()->sync([&] { value = session_->state_int(); });
  return value;
}

void SessionTest::flush() { flushQueues(*session_); }

}  // namespace saptest
