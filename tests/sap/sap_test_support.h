// Test doubles for TarvexSAPSession: a scriptable primitive layer that records every call, a
// scriptable delegate whose answers can be held back and released by the test, completion
// recorders, a log capture and a probe that tells when a session has been destroyed.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <tuple>
#include <vector>

#include "platform/data.h"
#include "platform/error.h"
#include "platform/log.h"
#include "platform/queue.h"
#include "platform/semaphore.h"
#include "platform/value.h"
#include "sap/tarvex_sap_session.h"

namespace saptest {

using Bytes = std::vector<uint8_t>;
using platform::Data;
using platform::Error;

// Only ever a guard against hangs: every wait normally returns at once.
inline constexpr std::chrono::seconds kGuard{10};

Data dataOf(std::string_view text);
std::string textOf(const Data& data);
std::string textOf(const uint8_t* bytes, size_t length);
// A malloc'ed copy that the receiver must free (malloc(1) for an empty text, so the pointer is
// never null).
uint8_t* mallocCopy(std::string_view text);

// Fails the current test unless `error` is in the session's domain with this code and this
// localized description (nullopt: no user-info at all).
void expectSessionError(const std::optional<Error>& error, int64_t code, const std::optional<std::string>& description);

// One call of each operation, waited for with the guard; a completion that never comes fails the
// test and yields a marker error in the "test" domain.
std::optional<Error> openSession(TarvexSAPSession& session);
std::pair<std::optional<Data>, std::optional<Error>> signWith(TarvexSAPSession& session,
                                                              const std::optional<platform::Value>& data);
std::pair<bool, std::optional<Error>> verifyWith(TarvexSAPSession& session, const std::optional<platform::Value>& signature,
                                                 const std::optional<platform::Value>& data);

// One completion, recorded: how often it ran, its first arguments and the queue it ran on.
template <class... A>
class Recorder : public std::enable_shared_from_this<Recorder<A...>> {
 public:
  std::function<void(A...)> handler() {
    auto self = this->shared_from_this();
    return [self](A... args) { self->record(std::move(args)...); };
  }
  // True once the completion has run; false after the guard deadline.
  bool wait(std::chrono::nanoseconds timeout = kGuard) {
    if (!done_.waitFor(timeout)) return false;
    done_.signal();  // later waits see it too
    return true;
  }
  int calls() const {
    std::lock_guard lock(mutex_);
    return calls_;
  }
  std::tuple<A...> result() const {
    std::lock_guard lock(mutex_);
    return *first_;
  }
  const platform::Queue* queue() const {
    std::lock_guard lock(mutex_);
    return queue_;
  }

 private:
  void record(A... args) {
    {
      std::lock_guard lock(mutex_);
      if (calls_++ == 0) {
        first_.emplace(std::move(args)...);
        queue_ = platform::Queue::current();
      }
    }
    done_.signal();
  }
  mutable std::mutex mutex_;
  int calls_ = 0;
  std::optional<std::tuple<A...>> first_;
  const platform::Queue* queue_ = nullptr;
  platform::Semaphore done_;
};

using OpenRecorder = Recorder<std::optional<Error>>;
using SignRecorder = Recorder<std::optional<Data>, std::optional<Error>>;
using VerifyRecorder = Recorder<bool, std::optional<Error>>;

// The lines the session logs while it lives, in order. Keeps the log at debug level.
class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<platform::LogEntry> entries() const;
  // Session lines only, as logged.
  std::vector<std::string> lines() const;
  // How many times this exact line was logged at this level.
  int count(platform::LogLevel level, std::string_view line) const;
  int countStartingWith(std::string_view prefix) const;
  void clear();

 private:
  struct Store {
    mutable std::mutex mutex;
    std::vector<platform::LogEntry> entries;
  };
  std::shared_ptr<Store> store_ = std::make_shared<Store>();
  platform::LogSettings previous_;
};

// Completes once the object holding token() (a session's primitive table) is destroyed.
class LifetimeProbe {
 public:
  std::shared_ptr<void> token();
  bool waitGone(std::chrono::nanoseconds timeout = kGuard);

 private:
  std::shared_ptr<platform::Semaphore> gone_ = std::make_shared<platform::Semaphore>();
};

// Lets everything already queued on the session's three queues run (twice over, for work that
// hops from one queue to another).
void flushQueues(TarvexSAPSession& session);
// Drops the last reference to `session` from the calling thread, after its queues have let go of
// it, so that the destructor joins the queue threads here rather than leaving them to wind down
// in the background; then waits until `lifetime` reports it gone.
void releaseSession(std::shared_ptr<TarvexSAPSession>& session, LifetimeProbe& lifetime);

// One scripted answer of the exchange primitive. `out` set: a malloc'ed buffer holding it.
struct ExchangeReply {
  int32_t status = 0;
  std::optional<uint8_t> returnCode;  // nullopt: left as the caller preset it
  std::optional<std::string> out;
};

// The primitive layer, scripted. Defaults: init makes a fresh handle and fills an empty hardware
// identifier; the first exchange of a handle answers "REQUEST(<input>)" with return code 1, the
// second completes with return code 0 and no output; sign answers "SIG(<data>)"; verify accepts
// exactly "RSP(<data>)"; teardown succeeds. Every call is recorded.
class FakeLayer : public std::enable_shared_from_this<FakeLayer> {
 public:
  struct ExchangeCall {
    int32_t selector;
    TarvexHWInfo_* hwInfo;
    QVSAPContextOpaque_* context;
    std::string input;
    bool presetsUntouched;  // *out null, *outLength 0, *returnCode 255 on entry
    const uint8_t* outBuffer;
  };
  struct SignCall {
    QVSAPContextOpaque_* context;
    std::string data;
    bool presetsUntouched;
    const uint8_t* outBuffer;
  };
  struct VerifyCall {
    QVSAPContextOpaque_* context;
    std::string signature;
    std::string data;
    const uint8_t* dataPointer;
  };

  // Scripts (set before the session uses them).
  int32_t initStatus = 0;
  std::function<std::optional<ExchangeReply>(int step, const std::string& input)> exchangeScript;  // nullopt: default
  int32_t signStatus = 0;
  bool signReturnsBufferOnFailure = true;
  int32_t verifyStatus = 0;        // used when the signature is valid
  bool verifyScribbles = false;    // overwrite the data it is given
  int32_t teardownStatus = 0;

  TarvexSAPPrimitives primitives(std::shared_ptr<void> lifetimeToken = nullptr);

  // Records.
  int initCalls() const;
  std::vector<QVSAPContextOpaque_*> handles() const;  // made by init, in order
  std::vector<TarvexHWInfo_*> initHwInfos() const;
  std::vector<TarvexHWInfo_> initHwSnapshots() const;  // the record as each init found it
  std::vector<ExchangeCall> exchanges() const;
  std::vector<SignCall> signs() const;
  std::vector<VerifyCall> verifies() const;
  std::vector<QVSAPContextOpaque_*> teardowns() const;
  // "init:N", "exchange:N", "sign:N", "verify:N", "teardown:N" with N the handle's number.
  std::vector<std::string> events() const;
  int number(QVSAPContextOpaque_* handle) const;
  // Calls that used a handle that was not live (never made, or already torn down).
  std::vector<std::string> deadHandleUses() const;

 private:
  int32_t init(QVSAPContextOpaque_** context, TarvexHWInfo_* hwInfo);
  int32_t exchange(int32_t selector, TarvexHWInfo_* hwInfo, QVSAPContextOpaque_* context, const uint8_t* in,
                   size_t inLength, uint8_t** out, uint32_t* outLength, uint8_t* returnCode);
  int32_t sign(QVSAPContextOpaque_* context, const uint8_t* data, size_t length, uint8_t** signature,
               uint32_t* signatureLength);
  int32_t verify(QVSAPContextOpaque_* context, const uint8_t* signature, size_t signatureLength, uint8_t* data,
                 size_t length);
  int32_t teardown(QVSAPContextOpaque_* context);
  int numberLocked(QVSAPContextOpaque_* handle) const;

  mutable std::mutex mutex_;
  int initCalls_ = 0;
  std::vector<QVSAPContextOpaque_*> handles_;
  std::vector<TarvexHWInfo_*> initHwInfos_;
  std::vector<TarvexHWInfo_> initHwSnapshots_;
  std::map<QVSAPContextOpaque_*, int> steps_;
  std::vector<ExchangeCall> exchanges_;
  std::vector<SignCall> signs_;
  std::vector<VerifyCall> verifies_;
  std::vector<QVSAPContextOpaque_*> teardowns_;
  std::vector<std::string> events_;
  std::set<QVSAPContextOpaque_*> live_;
  std::vector<std::string> deadHandleUses_;
};

// A delegate whose two answers are scripted. A held request keeps its completion until the test
// answers it (or drops it).
class ScriptedDelegate : public TarvexSAPSessionDelegate {
 public:
  struct Answer {
    std::optional<Data> data;
    std::optional<Error> error;
  };

  class Slot {
   public:
    // Keep the next requests' completions until release() or dropHeld().
    void hold();
    // Answer the next requests at once with this.
    void answerWith(Answer answer);
    // A misbehaving delegate: every answer calls the completion twice.
    void answerTwice();
    // One more request is being held (each held request is reported once).
    bool waitHeld(std::chrono::nanoseconds timeout = kGuard) { return heldSignal_.waitFor(timeout); }
    int asks() const;
    // Calls the oldest held completion `calls` times.
    void release(Answer answer, int calls = 1);
    void dropHeld();
    // Every request so far arrived on the session's delegate queue.
    bool onDelegateQueue() const;

   private:
    friend class ScriptedDelegate;
    void ask(TarvexSAPSession& session, TarvexSAPDataCompletion completion);

    mutable std::mutex mutex_;
    bool hold_ = false;
    int answerCalls_ = 1;
    Answer answer_;
    std::vector<TarvexSAPDataCompletion> held_;
    int asks_ = 0;
    bool onDelegateQueue_ = true;
    platform::Semaphore heldSignal_;
  };

  ScriptedDelegate();
  ~ScriptedDelegate() override;

  // The transport sets the session's TTL before it answers the handshake; nullopt: no TTL.
  void setTTLBeforeHandshakeAnswer(std::optional<double> ttl) {
    std::lock_guard lock(mutex_);
    ttl_ = ttl;
  }
  std::vector<std::optional<Data>> handshakeRequests() const {
    std::lock_guard lock(mutex_);
    return requests_;
  }

  Slot certificate;
  Slot handshake;

  void sessionRequestCertificateWithCompletionHandler(TarvexSAPSession& session,
                                                      TarvexSAPDataCompletion completion) override;
  void sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session,
                                                          const std::optional<Data>& handshakeData,
                                                          TarvexSAPDataCompletion completion) override;

 private:
  mutable std::mutex mutex_;
  std::optional<double> ttl_ = 3600.0;
  std::vector<std::optional<Data>> requests_;
};

// A session over a FakeLayer and a ScriptedDelegate, with its log captured. TearDown drops the
// session and waits until it is really gone, so no line or call leaks into the next test.
class SessionTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  std::shared_ptr<TarvexSAPSession> makeSession();
  // Drops `session` and waits for its destruction (the queued close has then run).
  void destroySession();

  // Waits for the completion; ADD_FAILURE and a marker error when it never comes.
  std::optional<Error> open();
  std::pair<std::optional<Data>, std::optional<Error>> sign(const std::optional<platform::Value>& data);
  std::pair<bool, std::optional<Error>> verify(const std::optional<platform::Value>& signature,
                                               const std::optional<platform::Value>& data);
  // Opens and checks that it worked.
  void openOrFail();

  // Internal state, read on the internal queue (runs no expiration check).
  uint64_t stateInt();
  // Lets everything already queued run: delegate calls, internal work, completions.
  void flush();

  std::shared_ptr<FakeLayer> layer_;
  std::shared_ptr<ScriptedDelegate> delegate_;
  std::unique_ptr<LogCapture> log_;
  std::shared_ptr<TarvexSAPSession> session_;
  std::unique_ptr<LifetimeProbe> lifetime_;
};

}  // namespace saptest
