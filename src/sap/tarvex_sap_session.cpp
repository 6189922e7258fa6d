#include "sap/tarvex_sap_session.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <ctime>
#include <vector>

#include "platform/log/log.h"
#include "platform/values/exception.h"

using platform::Data;
using platform::Error;
using platform::LogLevel;
using platform::Value;

namespace {

constexpr char kClassName[] = "TarvexSAPSession";
constexpr double kDistantFuture = 64092211200.0;  // 4001-01-01, far beyond any time-to-live

double now() { return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count(); }

std::string formatDate(double secondsSince1970) {
  // The TTL comes from the server: a huge one must not overflow the conversion to time_t.
  constexpr double kEarliest = -62135596800.0;  // 0001-01-01
  constexpr double kLatest = 253402300799.0;    // 9999-12-31 23:59:59
  const double clamped = std::isnan(secondsSince1970) ? 0.0 : std::clamp(secondsSince1970, kEarliest, kLatest);
  std::time_t t = static_cast<std::time_t>(clamped);
  std::tm tm{};
  gmtime_r(&t, &tm);
  char buf[40];
  std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S +0000", &tm);
  return buf;
}

std::string queueLabel(const void* session, const char* suffix) {
  return std::string(kClassName) + "-" + std::to_string(reinterpret_cast<uintptr_t>(session)) + "." + suffix;
}

// The open completion fires at most once, whatever a misbehaving delegate does.
TarvexSAPSession::OpenCompletion once(TarvexSAPSession::OpenCompletion completion) {
  auto fired = std::make_shared<std::atomic<bool>>(false);
  return [fired, completion = std::move(completion)](std::optional<Error> error) {
    if (!fired->exchange(true) && completion) completion(std::move(error));
  };
}

// A delegate that answers twice must not feed a second continuation into the open: the duplicate
// would find the state moved on and report the open as failed while it goes on to succeed.
TarvexSAPDataCompletion firstAnswerOnly(TarvexSAPDataCompletion answer) {
  auto answered = std::make_shared<std::atomic<bool>>(false);
  return [answered, answer = std::move(answer)](std::optional<Data> data, std::optional<Error> error) {
    if (!answered->exchange(true)) answer(std::move(data), std::move(error));
  };
}

// Owns an output buffer that a primitive allocated with malloc.
struct FreeBytes {
  void operator()(uint8_t* p) const { std::free(p); }
};

std::string className(const std::optional<Value>& v) { return v ? v->typeName() : "(null)"; }

}  // namespace

std::shared_ptr<TarvexSAPSession> TarvexSAPSession::sessionWithDelegate(
    std::weak_ptr<TarvexSAPSessionDelegate> delegate, TarvexSAPPrimitives primitives) {
  return std::make_shared<TarvexSAPSession>(Private{}, std::move(delegate), std::move(primitives));
}

std::shared_ptr<TarvexSAPSession> TarvexSAPSession::init() {
  throw platform::InternalInconsistencyException(std::string("Must use +[") + kClassName +
                                                 " initWithDelegate:] instead of +[" + kClassName + " init]!");
}

TarvexSAPSession::TarvexSAPSession(Private, std::weak_ptr<TarvexSAPSessionDelegate> delegate,
                                   TarvexSAPPrimitives primitives)
    : delegate_(std::move(delegate)),
      completionQueue_(platform::Queue::concurrent(queueLabel(this, "completionQueue"))),
      internalQueue_(platform::Queue::serial(queueLabel(this, "internalQueue"))),
      delegateQueue_(platform::Queue::concurrent(queueLabel(this, "delegateQueue"), 2)),
      expiration_(kDistantFuture),
      primitives_(std::move(primitives)) {}

TarvexSAPSession::~TarvexSAPSession() {
  // Queued work holds the session alive, so nothing else can be running now: close in place
  // rather than queueing a close that would outlive the context.
  _close();
}

std::optional<std::string> TarvexSAPSession::stateName(uint64_t state_int) {
  static const char* const names[] = {"[Closed]",
                                      "[Initialized]",
                                      "[Waiting For Certificate]",
                                      "[Generating Handshake Request]",
                                      "[Waiting For Handshake Response]",
                                      "[Processing Handshake Response]",
                                      "[Open]"};
  if (state_int > static_cast<uint64_t>(Step::Open)) return std::nullopt;
  return names[state_int];
}

void TarvexSAPSession::setStep(Step step) {
  step_ = step;
  observedState_.store(state_int(), std::memory_order_relaxed);
  observedExpiration_.store(expiration_, std::memory_order_relaxed);
  platform::log(LogLevel::Info, "[#TarvexSAPSession] self.state_int: %@", stateName(state_int()));
}

void TarvexSAPSession::_close() {
  platform::log(LogLevel::Default, "[#TarvexSAPSession] Closing session...");
  expiration_ = now();
  // The handle is kept on purpose: a later close tears it down again, which the primitives refuse
  // harmlessly, and the next open overwrites it.
  if (sessionContext_ && primitives_.teardown(sessionContext_) != 0)
    platform::log(LogLevel::Error, "[#TarvexSAPSession] Could not tear down Tarvex SAP session!");
  setStep(Step::Closed);
}

void TarvexSAPSession::_checkExpiration() {
  // An opening session has no valid expiration yet (a reopened one still carries the moment of
  // its last close), so only a closed or open session can expire.
  if (step_ != Step::Closed && step_ != Step::Open) return;
  if (expiration_ - now() < 0) {
    platform::log(LogLevel::Default, "[#TarvexSAPSession] Session is past expiration, closing session...");
    _close();
  }
}

double TarvexSAPSession::_secondsUntilExpiration() const { return expiration_ - now(); }

void TarvexSAPSession::_complete(const OpenCompletion& completion, std::optional<Error> error) {
  completionQueue_->async([completion, error = std::move(error)] { completion(error); });
}

void TarvexSAPSession::_failOpen(const OpenCompletion& completion, Error error) {
  _close();
  _complete(completion, std::move(error));
}

void TarvexSAPSession::openWithCompletionHandler(OpenCompletion completion) {
  internalQueue_->async(
      [self = shared_from_this(), completion = once(std::move(completion))] { self->_open(completion); });
}

void TarvexSAPSession::_open(OpenCompletion completion) {
  _checkExpiration();
  if (step_ != Step::Closed) {
    _complete(completion,
              QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState, "Session is already open or initializing."));
    return;
  }
  platform::log(LogLevel::Info, "[#TarvexSAPSession] Opening session...");
  int32_t status = primitives_.init(&sessionContext_, &hwInfo_);
  if (status != 0) {
    platform::log(LogLevel::Error, "[#TarvexSAPSession] Could not initialize session! (status: %d)", status);
    _complete(completion, QVSAPS_errorWithCode(TarvexSAPSessionErrorInternal, "Could not initialize session."));
    return;
  }
  const uint64_t generation = ++openGeneration_;
  setStep(Step::Initialized);
  setStep(Step::WaitingForCertificate);
  _askDelegate(
      generation, completion,
      [](TarvexSAPSessionDelegate& delegate, TarvexSAPSession& self, TarvexSAPDataCompletion answer) {
        delegate.sessionRequestCertificateWithCompletionHandler(self, std::move(answer));
      },
      &TarvexSAPSession::_receivedCertificate);
}

// One leg of the handshake: the delegate is asked on its queue, and its first answer continues the
// open on the internal queue.
void TarvexSAPSession::_askDelegate(uint64_t generation, OpenCompletion completion, DelegateLeg leg,
                                    Continuation next) {
  delegateQueue_->async([self = shared_from_this(), generation, completion, leg = std::move(leg), next] {
    auto delegate = self->delegate_.lock();
    if (!delegate) return;
    leg(*delegate, *self,
        firstAnswerOnly([self, generation, completion, next](std::optional<Data> answer, std::optional<Error> error) {
          self->internalQueue_->async(
              [self, generation, completion, next, answer = std::move(answer), error = std::move(error)]() mutable {
                ((*self).*next)(generation, std::move(answer), std::move(error), completion);
              });
        }));
  });
}

bool TarvexSAPSession::_stillOpening(uint64_t generation, Step expected, const OpenCompletion& completion) {
  if (generation == openGeneration_ && step_ == expected) return true;
  // The session was closed (or reopened) while the delegate worked: leave it alone.
  _complete(completion, QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState));
  return false;
}

// What one exchange primitive call gave back; the output buffer is the primitive's malloc'd one.
struct TarvexSAPSession::Exchanged {
  int32_t status = 0;
  uint8_t returnCode = 255;
  std::unique_ptr<uint8_t, FreeBytes> out;
  uint32_t outLength = 0;
};

TarvexSAPSession::Exchanged TarvexSAPSession::_exchange(const Data& input) {
  Exchanged result;
  uint8_t* out = nullptr;
  result.status = primitives_.exchange(kTarvexSAPExchangeSelector, &hwInfo_, sessionContext_, input.bytes(),
                                       input.length(), &out, &result.outLength, &result.returnCode);
  result.out.reset(out);
  return result;
}

void TarvexSAPSession::_receivedCertificate(uint64_t generation, std::optional<Data> certificate,
                                            std::optional<Error> error, OpenCompletion completion) {
  if (!_stillOpening(generation, Step::WaitingForCertificate, completion)) return;
  if (error) {
    platform::log(LogLevel::Error, "[#TarvexSAPSession] Error requesting certificate: %@", error);
    return _failOpen(completion, std::move(*error));
  }
  if (!certificate || certificate->empty()) {
    platform::log(LogLevel::Default, "[#TarvexSAPSession] Invalid certificate received!");
    return _failOpen(completion, QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidParameter));
  }
  platform::log(LogLevel::Info, "[#TarvexSAPSession] Received certificate!");
  setStep(Step::GeneratingHandshakeRequest);

  Exchanged request = _exchange(*certificate);
  if (request.status != 0 || request.returnCode != 1 || !request.out || request.outLength == 0) {
    platform::log(LogLevel::Error,
                  "[#TarvexSAPSession] Could not generate handshake request data! (status: %d, returnCode: %d)",
                  request.status, request.returnCode);
    return _failOpen(completion, QVSAPS_errorWithCode(TarvexSAPSessionErrorInternal));
  }
  Data body = Data::adoptMalloc(request.out.release(), request.outLength);
  setStep(Step::WaitingForHandshakeResponse);
  _askDelegate(
      generation, completion,
      [body](TarvexSAPSessionDelegate& delegate, TarvexSAPSession& self, TarvexSAPDataCompletion answer) {
        delegate.sessionRequestHandshakeWithServerCompletionHandler(self, body, std::move(answer));
      },
      &TarvexSAPSession::_receivedHandshake);
}

void TarvexSAPSession::_receivedHandshake(uint64_t generation, std::optional<Data> response, std::optional<Error> error,
                                          OpenCompletion completion) {
  if (!_stillOpening(generation, Step::WaitingForHandshakeResponse, completion)) return;
  if (error) {
    platform::log(LogLevel::Error, "[#TarvexSAPSession] Error requesting handshake: %@", error);
    return _failOpen(completion, std::move(*error));
  }
  if (!response) {
    platform::log(LogLevel::Default, "[#TarvexSAPSession] Invalid handshake response received!");
    return _failOpen(completion, QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidParameter));
  }
  platform::log(LogLevel::Info, "[#TarvexSAPSession] Received handshake response!");
  setStep(Step::ProcessingHandshakeResponse);

  // Nothing follows the handshake, so any output is unread; and one round trip only: a primitive
  // that wants another round has failed.
  Exchanged done = _exchange(*response);
  if (done.status == 0 && done.returnCode == 0) {
    setStep(Step::Open);
    _complete(completion, std::nullopt);
    return;
  }
  platform::log(LogLevel::Error,
                "[#TarvexSAPSession] Could not process handshake response! (status: %d, returnCode: %d)", done.status,
                done.returnCode);
  _failOpen(completion, QVSAPS_errorWithCode(TarvexSAPSessionErrorInternal));
}

void TarvexSAPSession::close() {
  internalQueue_->async([self = shared_from_this()] { self->_close(); });
}

void TarvexSAPSession::signatureForData(const platform::Data& data, SignCompletion completion) {
  signatureForData(std::optional<Value>(Value(data)), std::move(completion));
}

void TarvexSAPSession::signatureForData(const std::optional<Value>& data, SignCompletion completion) {
  if (!completion) return;
  internalQueue_->async([self = shared_from_this(), data, completion = std::move(completion)] {
    auto reply = [&](std::optional<Data> signature, std::optional<Error> error) {
      self->completionQueue_->async(
          [completion, signature = std::move(signature), error = std::move(error)] { completion(signature, error); });
    };
    platform::log(LogLevel::Info, "[#TarvexSAPSession] Generating signature...");
    self->_checkExpiration();
    if (!data || !data->isData()) {
      platform::log(LogLevel::Info, "[#TarvexSAPSession] Invalid parameter! (data.class: %@, data: %@)",
                    className(data), data);
      reply(std::nullopt, QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidParameter));
      return;
    }
    if (self->step_ != Step::Open) {
      reply(std::nullopt,
            QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState, "Session must be open to generate signature."));
      return;
    }
    const Data& bytes = *data->data();
    uint8_t* raw = nullptr;
    uint32_t signatureLength = 0;
    int32_t status =
        self->primitives_.sign(self->sessionContext_, bytes.bytes(), bytes.length(), &raw, &signatureLength);
    std::unique_ptr<uint8_t, FreeBytes> signature(raw);
    if (status != 0) {
      platform::log(LogLevel::Error, "[#TarvexSAPSession] Could not generate signature! (status: %d)", status);
      reply(std::nullopt, QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidParameter));
      return;
    }
    reply(Data::adoptMalloc(signature.release(), signatureLength), std::nullopt);
  });
}

void TarvexSAPSession::verifySignature(const std::optional<platform::Data>& signature, const platform::Data& data,
                                       VerifyCompletion completion) {
  std::optional<Value> sig;
  if (signature) sig = Value(*signature);
  verifySignature(sig, std::optional<Value>(Value(data)), std::move(completion));
}

void TarvexSAPSession::verifySignature(const std::optional<Value>& signature, const std::optional<Value>& data,
                                       VerifyCompletion completion) {
  if (!completion) return;
  internalQueue_->async([self = shared_from_this(), signature, data, completion = std::move(completion)] {
    auto reply = [&](bool valid, std::optional<Error> error) {
      self->completionQueue_->async([completion, valid, error = std::move(error)] { completion(valid, error); });
    };
    platform::log(LogLevel::Info, "[#TarvexSAPSession] Verifying signature...");
    if (!signature || !signature->isData() || !data || !data->isData()) {
      platform::log(
          LogLevel::Info,
          "[#TarvexSAPSession] Invalid parameter! (signature.class: %@, data.class: %@, signature: %@, data: %@)",
          className(signature), className(data), signature, data);
      reply(false, QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidParameter));
      return;
    }
    if (self->step_ != Step::Open) {
      reply(false,
            QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidState, "Session must be open to verify signature."));
      return;
    }
    const Data& sig = *signature->data();
    // The primitive may write into the data; it gets a private copy.
    std::vector<uint8_t> copy = data->data()->toVector();
    int32_t status =
        self->primitives_.verify(self->sessionContext_, sig.bytes(), sig.length(), copy.data(), copy.size());
    self->_checkExpiration();
    if (status != 0) {
      platform::log(LogLevel::Default, "[#TarvexSAPSession] Signature verification failed! (status: %d)", status);
      reply(false, QVSAPS_errorWithCode(TarvexSAPSessionErrorInvalidParameter));
      return;
    }
    reply(true, std::nullopt);
  });
}

TarvexSAPSessionState TarvexSAPSession::state() {
  TarvexSAPSessionState result = TarvexSAPSessionStateClosed;
  internalQueue_->sync([&] {
    _checkExpiration();
    // Every step between closed and open is one public state: initializing.
    if (step_ == Step::Open)
      result = TarvexSAPSessionStateOpen;
    else if (step_ != Step::Closed)
      result = TarvexSAPSessionStateInitializing;
  });
  return result;
}

double TarvexSAPSession::TTL() {
  double ttl = 0.0;
  internalQueue_->sync([&] {
    if (step_ == Step::Open) ttl = _secondsUntilExpiration();
  });
  return ttl;
}

void TarvexSAPSession::setTTL(double seconds) {
  internalQueue_->barrierSync([&] {
    expiration_ = now() + seconds;
    observedExpiration_.store(expiration_, std::memory_order_relaxed);
    platform::log(LogLevel::Debug, "[#TarvexSAPSession] Setting TTL... (TTL: %f, self.expiration: %@)", seconds,
                  formatDate(expiration_));
  });
}

TarvexSAPSessionState TarvexSAPSession::observedState() const {
  auto step = static_cast<Step>(observedState_.load(std::memory_order_relaxed));
  if (step == Step::Closed) return TarvexSAPSessionStateClosed;
  return step == Step::Open ? TarvexSAPSessionStateOpen : TarvexSAPSessionStateInitializing;
}

double TarvexSAPSession::observedTTL() const {
  if (static_cast<Step>(observedState_.load(std::memory_order_relaxed)) != Step::Open) return 0.0;
  return observedExpiration_.load(std::memory_order_relaxed) - now();
}

std::string TarvexSAPSession::description() {
  static const char* const names[] = {"[Closed]", "[Initializing]", "[Open]"};
  TarvexSAPSessionState s = state();
  char ttl[64];
  std::snprintf(ttl, sizeof ttl, "%f", TTL());
  return std::string(kClassName) + " <state: " + names[s] + ", TTL: " + ttl + "s>";
}
