// The session's two seams, faked, and a fixture that makes a session over them with its log
// captured. The primitives record their calls as events ("init:1", "exchange:1", "sign:1",
// "verify:1", "teardown:1", the number naming the handle) and fail the test when the session
// breaks the call contract: another selector, outputs not preset, a handle that is not live.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <tuple>
#include <vector>

#include "common/log_capture.h"
#include "platform/semaphore.h"
#include "sap/tarvex_sap_session.h"

namespace saptest {

using platform::Data;
using platform::Error;
using platform::Value;

inline constexpr std::chrono::seconds kGuard{10};  // a hang guard only

// One scripted exchange; returnCode nullopt leaves the session's preset, out nullopt gives no buffer.
struct Exchange {
  int32_t status = 0;
  std::optional<uint8_t> returnCode;
  std::optional<std::string> out;
};

// By default the first exchange of a handle answers "REQ(<input>)" with return code 1 and the
// second completes with 0; sign answers "SIG(<data>)"; verify accepts exactly "RSP(<data>)" and
// then overwrites the data it was given, as it may.
struct FakePrimitives : std::enable_shared_from_this<FakePrimitives> {
  int32_t initStatus = 0, signStatus = 0, verifyStatus = 0, teardownStatus = 0;
  std::optional<Exchange> first, second;

  TarvexSAPPrimitives table();
  std::vector<std::string> events() const;
  int count(const std::string& prefix) const;  // events starting with it

  mutable std::mutex mutex;
  std::vector<std::string> recorded;
  std::set<QVSAPContextOpaque_*> live;
  uintptr_t made = 0;
};

struct Answer {
  std::optional<Data> data = std::nullopt;
  std::optional<Error> error = std::nullopt;
};

// Answers each leg with its script, `calls` times (a misbehaving delegate calls twice), the
// handshake after setting `ttl` on the session; a leg scripted nullopt is held until released.
struct FakeDelegate : TarvexSAPSessionDelegate {
  std::optional<Answer> certificate = Answer{Data::fromString("CERT")}, handshake = Answer{Data::fromString("INFO")};
  int calls = 1;
  std::optional<double> ttl = 3600.0;

  bool waitHeld() { return held.waitFor(kGuard); }  // one more request is being held
  void release(const Answer& answer);               // answers the oldest held request
  void answer(const std::optional<Answer>& script, TarvexSAPDataCompletion completion);
  void sessionRequestCertificateWithCompletionHandler(TarvexSAPSession&, TarvexSAPDataCompletion completion) override {
    answer(certificate, std::move(completion));
  }
  void sessionRequestHandshakeWithServerCompletionHandler(TarvexSAPSession& session, const std::optional<Data>&,
                                                          TarvexSAPDataCompletion completion) override {
    if (ttl) session.setTTL(*ttl);  // the transport sets it before it answers
    answer(handshake, std::move(completion));
  }

  std::mutex mutex;
  std::deque<TarvexSAPDataCompletion> waiting;
  platform::Semaphore held;
};

// A completion that records its first call's arguments, how many calls came, and whether any ran
// off `queue`.
template <class... A>
struct Recorder : std::enable_shared_from_this<Recorder<A...>> {
  std::function<void(A...)> handler(std::shared_ptr<platform::Queue> queue) {
    return [self = this->shared_from_this(), queue](A... args) {
      {
        std::lock_guard lock(self->mutex);
        if (self->calls++ == 0) self->first.emplace(std::move(args)...);
        self->offQueue = self->offQueue || !queue->isCurrent();
      }
      self->done.signal();
    };
  }
  // The first call's arguments; nullopt, and a test failure, when none came in time.
  std::optional<std::tuple<A...>> wait() {
    if (!done.waitFor(kGuard)) ADD_FAILURE() << "no completion";
    std::lock_guard lock(mutex);
    return first;
  }
  int count() {
    std::lock_guard lock(mutex);
    return calls;
  }

  std::mutex mutex;
  int calls = 0;
  bool offQueue = false;
  std::optional<std::tuple<A...>> first;
  platform::Semaphore done;
};
using OpenRecorder = Recorder<std::optional<Error>>;
using SignRecorder = Recorder<std::optional<Data>, std::optional<Error>>;
using VerifyRecorder = Recorder<bool, std::optional<Error>>;

class SessionTest : public ::testing::Test {
 protected:
  void TearDown() override;

  // Each waits for its completion and checks that it came once, on the completion queue; one that
  // never came gives the error "test".
  std::optional<Error> open();
  std::pair<std::optional<Data>, std::optional<Error>> sign(const std::optional<Value>& data);
  std::pair<bool, std::optional<Error>> verify(const std::optional<Value>& signature, const std::optional<Value>& data);
  void openOrFail();
  std::shared_ptr<OpenRecorder> startOpen();  // without waiting
  uint64_t stateInt();                        // read on the internal queue, with no expiration check
  void flush();                               // lets everything already queued on the three queues run

  zlkatest::LogCapture log_;
  std::shared_ptr<FakePrimitives> primitives_ = std::make_shared<FakePrimitives>();
  std::shared_ptr<FakeDelegate> delegate_ = std::make_shared<FakeDelegate>();
  std::shared_ptr<TarvexSAPSession> session_ = TarvexSAPSession::sessionWithDelegate(delegate_, primitives_->table());
};

}  // namespace saptest

namespace platform {
// Failure messages show errors as text.
inline void PrintTo(const Error& error, std::ostream* out) { *out << error.description(); }
}  // namespace platform
