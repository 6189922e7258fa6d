// TarvexSAPSession: the one secure association with the device-services back end.
//
// It owns a primitive context, opens it with a two-message handshake whose network legs its
// delegate carries, then signs request bodies and verifies answers until its expiration passes;
// any use after that closes it, and it must be opened again. Every operation is asynchronous and
// reports through its completion on the concurrent completion queue; state changes and primitive
// calls run on the serial internal queue, delegate calls on the concurrent delegate queue.
//
// state(), TTL(), setTTL() and description() wait for the internal queue: never call them from it
// (completions and delegate calls run elsewhere, so they may). The delegate is held weakly; keep
// it alive while an open runs, or the open never completes.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/dispatch/queue.h"
#include "platform/values/data.h"
#include "platform/values/error.h"
#include "platform/values/uuid.h"
#include "platform/values/value.h"
#include "sap/tarvex_sap_primitives.h"
#include "sap/tarvex_sap_session_delegate.h"
#include "sap/tarvex_sap_session_error.h"

enum TarvexSAPSessionState : uint64_t {
  TarvexSAPSessionStateClosed = 0,
  TarvexSAPSessionStateInitializing = 1,
  TarvexSAPSessionStateOpen = 2,
};

class TarvexSAPSession : public std::enable_shared_from_this<TarvexSAPSession> {
 public:
  using OpenCompletion = std::function<void(std::optional<platform::Error>)>;
  using SignCompletion = std::function<void(std::optional<platform::Data>, std::optional<platform::Error>)>;
  using VerifyCompletion = std::function<void(bool, std::optional<platform::Error>)>;

  // sessionWithDelegate makes a closed session over `primitives` that asks `delegate` (held weakly)
  // for the network legs of its opens. It makes the three queues and cannot fail otherwise.
  static std::shared_ptr<TarvexSAPSession> sessionWithDelegate(
      std::weak_ptr<TarvexSAPSessionDelegate> delegate,
      TarvexSAPPrimitives primitives = TarvexSAPPrimitives::library());
  // Forbidden: sessions are made with sessionWithDelegate. Throws InternalInconsistencyException.
  [[noreturn]] static std::shared_ptr<TarvexSAPSession> init();
  ~TarvexSAPSession();

  // openWithCompletionHandler returns at once and opens the session: a primitive context, the
  // certificate and handshake legs through the delegate, the exchange. `completion` gets nullopt
  // once the session is open; otherwise the session is closed again and it gets InvalidState (-7)
  // when the session was not closed or was closed or reopened meanwhile, Internal (-4) when a
  // primitive fails, InvalidParameter (-3) when a leg answers no data, or the delegate's own error.
  // An empty completion still opens.
  void openWithCompletionHandler(OpenCompletion completion);
  // close tears the primitive context down on the internal queue and returns at once.
  void close();
  // signatureForData signs `data` (bytes; anything else is InvalidParameter) with the open session
  // and passes the signature to `completion`, or nullopt with InvalidState (-7) when the session
  // is not open (an expired one is closed first) and InvalidParameter (-3) when the primitive fails.
  // An empty completion does nothing at all.
  void signatureForData(const std::optional<platform::Value>& data, SignCompletion completion);
  // As above, for bytes.
  void signatureForData(const platform::Data& data, SignCompletion completion);
  // verifySignature passes true to `completion` when `signature` is the server's valid signature of
  // `data` for a request this session signed; otherwise false with InvalidParameter (-3) for
  // arguments that are not bytes or a signature the primitive refuses, or InvalidState (-7) when
  // the session is not open. An empty completion does nothing at all.
  void verifySignature(const std::optional<platform::Value>& signature, const std::optional<platform::Value>& data,
                       VerifyCompletion completion);
  // As above, for bytes; a missing signature is InvalidParameter.
  void verifySignature(const std::optional<platform::Data>& signature, const platform::Data& data,
                       VerifyCompletion completion);

  // state is Closed, Initializing (any step of an open) or Open; an expired session is closed first.
  TarvexSAPSessionState state();
  // TTL is the seconds left while open (negative once past), else 0.
  double TTL();
  // setTTL makes the session expire `seconds` from now.
  void setTTL(double seconds);
  // description renders the session for logs: "TarvexSAPSession <state: [Open], TTL: 3599.998000s>".
  std::string description();

  // observedState and observedTTL answer at once, from any thread (the internal queue included),
  // for monitoring: the state and seconds left as the internal queue last set them. Unlike
  // state(), they do not close an expired session, so an open one past its time reads as open
  // with a negative TTL until its next use closes it.
  TarvexSAPSessionState observedState() const;
  double observedTTL() const;

  // The session's identity, its delegate and its queues as made at construction; the references
  // are borrowed from the session, the queues shared.
  const platform::UUID& UUID() const { return uuid_; }
  std::weak_ptr<TarvexSAPSessionDelegate> delegate() const { return delegate_; }
  const std::shared_ptr<platform::Queue>& completionQueue() const { return completionQueue_; }
  const std::shared_ptr<platform::Queue>& internalQueue() const { return internalQueue_; }
  const std::shared_ptr<platform::Queue>& delegateQueue() const { return delegateQueue_; }

  // The steps of the session's life; the numbers are what the log and the tests know them by.
  enum class Step : uint64_t {
    Closed = 0,
    Initialized = 1,
    WaitingForCertificate = 2,
    GeneratingHandshakeRequest = 3,
    WaitingForHandshakeResponse = 4,
    ProcessingHandshakeResponse = 5,
    Open = 6,
  };
  // The current step as its number, readable on the internal queue only (and by tests through it).
  uint64_t state_int() const { return static_cast<uint64_t>(step_); }
  // "[Waiting For Certificate]" and so on; nullopt for a number that is no step.
  static std::optional<std::string> stateName(uint64_t state_int);

 private:
  struct Private {};

 public:
  // Only sessionWithDelegate() can call this, through make_shared.
  TarvexSAPSession(Private, std::weak_ptr<TarvexSAPSessionDelegate> delegate, TarvexSAPPrimitives primitives);

 private:
  // All of these run on the internal queue.
  using Continuation = void (TarvexSAPSession::*)(uint64_t generation, std::optional<platform::Data> answer,
                                                  std::optional<platform::Error> error, OpenCompletion completion);
  using DelegateLeg = std::function<void(TarvexSAPSessionDelegate&, TarvexSAPSession&, TarvexSAPDataCompletion)>;
  struct Exchanged;

  void setStep(Step step);
  void _close();
  void _checkExpiration();
  void _open(OpenCompletion completion);
  void _askDelegate(uint64_t generation, OpenCompletion completion, DelegateLeg leg, Continuation next);
  void _receivedCertificate(uint64_t generation, std::optional<platform::Data> certificate,
                            std::optional<platform::Error> error, OpenCompletion completion);
  void _receivedHandshake(uint64_t generation, std::optional<platform::Data> response,
                          std::optional<platform::Error> error, OpenCompletion completion);
  Exchanged _exchange(const platform::Data& input);
  bool _stillOpening(uint64_t generation, Step expected, const OpenCompletion& completion);
  void _failOpen(const OpenCompletion& completion, platform::Error error);
  void _complete(const OpenCompletion& completion, std::optional<platform::Error> error);
  double _secondsUntilExpiration() const;

  std::weak_ptr<TarvexSAPSessionDelegate> delegate_;
  const platform::UUID uuid_;
  Step step_ = Step::Closed;
  std::shared_ptr<platform::Queue> completionQueue_;
  std::shared_ptr<platform::Queue> internalQueue_;
  std::shared_ptr<platform::Queue> delegateQueue_;
  QVSAPContextOpaque_* sessionContext_ = nullptr;
  TarvexHWInfo_ hwInfo_{};
  double expiration_;  // seconds since 1970
  uint64_t openGeneration_ = 0;
  TarvexSAPPrimitives primitives_;
  // Mirrors of step_ and expiration_ for observedState() and observedTTL().
  std::atomic<uint64_t> observedState_{0};
  std::atomic<double> observedExpiration_{0};
};
