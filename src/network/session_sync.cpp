// Synchronous use of the secure-association session by the request pipeline: open (no time limit),
// sign and verify (10 seconds each), and the signed HTTP request.
#include <chrono>
#include <mutex>

#include "network/signed_request.h"
#include "network/zlka_network.h"
#include "platform/dispatch/semaphore.h"
#include "platform/log/log.h"
#include "support/message_ids.h"

using platform::Data;
using platform::Error;
using platform::LogLevel;

namespace {

constexpr auto kSessionWait = std::chrono::seconds(10);

// Shared between a waiter and a completion that may arrive after the waiter gave up.
template <class Result>
struct Rendezvous {
  platform::Semaphore done;
  std::mutex mutex;
  Result result{};
  std::optional<Error> error;
};

}  // namespace

std::optional<Error> ZLKANetwork::_openTarvexSAPSession() {
  std::shared_ptr<TarvexSAPSession> session = tarvexSAPSession();
  // Open, or being opened by another request right now: usable either way.
  if (session->state() != TarvexSAPSessionStateClosed) return std::nullopt;
  platform::log(LogLevel::Default, "[#TokenAuth] Opening Tarvex SAP session...");
  auto shared = std::make_shared<Rendezvous<bool>>();
  session->openWithCompletionHandler([shared](std::optional<Error> error) {
    if (error) {
      platform::log(LogLevel::Error, kMessageSessionFailed, "[#TokenAuth] Couldn't open Tarvex SAP session:\n%@",
                    error);
    } else {
      platform::log(LogLevel::Default, kMessageSessionOpened, "[#TokenAuth] Tarvex SAP session opened!");
    }
    {
      std::lock_guard lock(shared->mutex);
      shared->error = std::move(error);
    }
    shared->done.signal();
  });
  shared->done.wait();
  std::lock_guard lock(shared->mutex);
  return shared->error;
}

std::optional<Data> ZLKANetwork::_tarvexSignatureForDataSync(const Data& data, bool* timedOut,
                                                             std::optional<Error>* error) {
  if (timedOut) *timedOut = false;
  if (error) *error = std::nullopt;
  if (std::optional<Error> openError = _openTarvexSAPSession()) {
    if (error) *error = std::move(openError);
    return std::nullopt;
  }
  auto shared = std::make_shared<Rendezvous<std::optional<Data>>>();
  tarvexSAPSession()->signatureForData(data, [shared](std::optional<Data> signature, std::optional<Error> signError) {
    {
      std::lock_guard lock(shared->mutex);
      shared->result = std::move(signature);
      shared->error = std::move(signError);
    }
    shared->done.signal();
  });
  if (!shared->done.waitFor(kSessionWait)) {
    platform::log(LogLevel::Error, "[#TokenAuth] Timed out waiting to generate Tarvex SAP signature!");
    if (timedOut) *timedOut = true;
    return std::nullopt;  // a late completion lands in storage nobody reads
  }
  std::lock_guard lock(shared->mutex);
  if (error) *error = shared->error;
  return shared->result;
}

bool ZLKANetwork::_verifyTarvexSignatureSync(const std::optional<Data>& signature, const Data& data, bool* timedOut,
                                             std::optional<Error>* error) {
  if (timedOut) *timedOut = false;
  if (error) *error = std::nullopt;
  // No open here: the answer is verified with the association that signed its request.
  auto shared = std::make_shared<Rendezvous<bool>>();
  tarvexSAPSession()->verifySignature(signature, data, [shared](bool valid, std::optional<Error> verifyError) {
    {
      std::lock_guard lock(shared->mutex);
      shared->result = valid;
      shared->error = std::move(verifyError);
    }
    shared->done.signal();
  });
  if (!shared->done.waitFor(kSessionWait)) {
    platform::log(LogLevel::Error, "[#TokenAuth] Timed out waiting to verify Tarvex SAP signature!");
    if (timedOut) *timedOut = true;
    return false;
  }
  std::lock_guard lock(shared->mutex);
  if (error) *error = shared->error;
  return shared->result;
}

platform::HTTPRequest ZLKANetwork::_generateTokenAuthURLRequestForEndpoint(const std::string& endpoint,
                                                                           const std::optional<std::string>& sessionID,
                                                                           const std::optional<Data>& signature) {
  return signed_request::jsonPost(_selectedAPIServer() + "/" + endpoint, sessionID, signature);
}
