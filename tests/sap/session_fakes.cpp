#include "session_fakes.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

namespace saptest {

namespace {

uint8_t* mallocCopy(const std::string& text) {
  auto* buffer = static_cast<uint8_t*>(std::malloc(std::max<size_t>(text.size(), 1)));
  std::memcpy(buffer, text.data(), text.size());
  return buffer;
}

std::string textOf(const uint8_t* bytes, size_t length) { return length ? std::string(reinterpret_cast<const char*>(bytes), length) : ""; }

// Handles are the numbers 1, 2, ... as tokens, never dereferenced.
std::string event(FakePrimitives& p, const char* what, QVSAPContextOpaque_* handle, bool mustBeLive) {
  std::string e = std::string(what) + ":" + std::to_string(reinterpret_cast<uintptr_t>(handle));
  if (mustBeLive && !p.live.count(handle)) ADD_FAILURE() << e << " uses a handle that is not live";
  p.recorded.push_back(e);
  return e;
}

// Makes the call with a recorder, waits, and checks that the completion came once, on its queue.
template <class R, class Call>
auto settled(TarvexSAPSession& session, Call call, const std::function<void()>& flush) {
  auto done = std::make_shared<R>();
  call(done->handler(session.completionQueue()));
  auto result = done->wait();
  flush();
  EXPECT_EQ(done->count(), 1);
  EXPECT_FALSE(done->offQueue) << "a completion ran off the completion queue";
  return result;
}

}  // namespace

TarvexSAPPrimitives FakePrimitives::table() {
  auto self = shared_from_this();
  TarvexSAPPrimitives p;
  p.init = [self](QVSAPContextOpaque_** context, TarvexHWInfo_*) {
    std::lock_guard lock(self->mutex);
    if (self->initStatus != 0) return self->initStatus;
    *context = reinterpret_cast<QVSAPContextOpaque_*>(++self->made);
    self->live.insert(*context);
    event(*self, "init", *context, true);
    return 0;
  };
  p.exchange = [self](int32_t selector, TarvexHWInfo_*, QVSAPContextOpaque_* context, const uint8_t* in, size_t inLength, uint8_t** out,
                      uint32_t* outLength, uint8_t* returnCode) {
    EXPECT_EQ(selector, kTarvexSAPExchangeSelector);
    EXPECT_TRUE(*out == nullptr && *outLength == 0 && *returnCode == 255) << "outputs must start null, 0 and 255";
    std::lock_guard lock(self->mutex);
    const std::string e = event(*self, "exchange", context, true);
    const bool firstOfHandle = std::count(self->recorded.begin(), self->recorded.end(), e) == 1;
    const Exchange reply = firstOfHandle ? self->first.value_or(Exchange{0, 1, "REQ(" + textOf(in, inLength) + ")"})
                                         : self->second.value_or(Exchange{0, 0, std::nullopt});
    if (reply.out) {
      *out = mallocCopy(*reply.out);
      *outLength = static_cast<uint32_t>(reply.out->size());
    }
    if (reply.returnCode) *returnCode = *reply.returnCode;
    return reply.status;
  };
  p.sign = [self](QVSAPContextOpaque_* context, const uint8_t* data, size_t length, uint8_t** signature, uint32_t* signatureLength) {
    EXPECT_TRUE(*signature == nullptr && *signatureLength == 0) << "outputs must start null and 0";
    std::lock_guard lock(self->mutex);
    event(*self, "sign", context, true);
    const std::string text = "SIG(" + textOf(data, length) + ")";
    *signature = mallocCopy(text);  // even on failure: the session frees it either way
    *signatureLength = static_cast<uint32_t>(text.size());
    return self->signStatus;
  };
  p.verify = [self](QVSAPContextOpaque_* context, const uint8_t* signature, size_t signatureLength, uint8_t* data, size_t length) {
    std::lock_guard lock(self->mutex);
    event(*self, "verify", context, true);
    const bool valid = textOf(signature, signatureLength) == "RSP(" + textOf(data, length) + ")";
    if (length) std::memset(data, 'X', length);
    return valid ? self->verifyStatus : -6;
  };
  p.teardown = [self](QVSAPContextOpaque_* context) {
    std::lock_guard lock(self->mutex);
    event(*self, "teardown", context, false);  // a dead handle is refused harmlessly, as the library does
    self->live.erase(context);
    return self->teardownStatus;
  };
  return p;
}

std::vector<std::string> FakePrimitives::events() const {
  std::lock_guard lock(mutex);
  return recorded;
}

int FakePrimitives::count(const std::string& prefix) const {
  std::lock_guard lock(mutex);
  return static_cast<int>(std::count_if(recorded.begin(), recorded.end(), [&](const std::string& e) { return e.starts_with(prefix); }));
}

void FakeDelegate::answer(const std::optional<Answer>& script, TarvexSAPDataCompletion completion) {
  if (!script) {
    std::lock_guard lock(mutex);
    waiting.push_back(std::move(completion));
    held.signal();
    return;
  }
  for (int i = 0; i < calls; ++i) completion(script->data, script->error);
}

void FakeDelegate::release(const Answer& answer) {
  TarvexSAPDataCompletion completion;
  {
    std::lock_guard lock(mutex);
    ASSERT_FALSE(waiting.empty()) << "no request is held";
    completion = std::move(waiting.front());
    waiting.pop_front();
  }
  completion(answer.data, answer.error);
}

void SessionTest::TearDown() {
  if (delegate_) {
    std::lock_guard lock(delegate_->mutex);
    std::deque<TarvexSAPDataCompletion> dropped;  // held completions keep the session alive
    dropped.swap(delegate_->waiting);
  }
  if (session_) flush();
  session_.reset();
}

std::optional<Error> SessionTest::open() {
  auto result = settled<OpenRecorder>(
      *session_, [&](auto h) { session_->openWithCompletionHandler(h); }, [this] { flush(); });
  return result ? std::get<0>(*result) : Error("test", 0);
}

std::pair<std::optional<Data>, std::optional<Error>> SessionTest::sign(const std::optional<Value>& data) {
  auto result = settled<SignRecorder>(
      *session_, [&](auto h) { session_->signatureForData(data, h); }, [this] { flush(); });
  return result ? std::pair(std::get<0>(*result), std::get<1>(*result)) : std::pair(std::optional<Data>(), std::optional(Error("test", 0)));
}

std::pair<bool, std::optional<Error>> SessionTest::verify(const std::optional<Value>& signature, const std::optional<Value>& data) {
  auto result = settled<VerifyRecorder>(
      *session_, [&](auto h) { session_->verifySignature(signature, data, h); }, [this] { flush(); });
  return result ? std::pair(std::get<0>(*result), std::get<1>(*result)) : std::pair(false, std::optional(Error("test", 0)));
}

void SessionTest::openOrFail() {
  const auto error = open();
  ASSERT_FALSE(error) << error->description();
  ASSERT_EQ(stateInt(), 6u);
}

std::shared_ptr<OpenRecorder> SessionTest::startOpen() {
  auto done = std::make_shared<OpenRecorder>();
  session_->openWithCompletionHandler(done->handler(session_->completionQueue()));
  return done;
}

uint64_t SessionTest::stateInt() {
  uint64_t value = 99;
  session_->internalQueue()->sync([&] { value = session_->state_int(); });
  return value;
}

void SessionTest::flush() {
  for (int round = 0; round < 2; ++round) {  // twice: work hops from one queue to another
    session_->delegateQueue()->barrierSync([] {});
    session_->internalQueue()->sync([] {});
    session_->completionQueue()->barrierSync([] {});
  }
}

}  // namespace saptest
