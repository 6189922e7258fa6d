// ZLKAClient: the daemon's three token operations, called over D-Bus.
//
//   auto client = zlka_client::ZLKAClient::connect({.bus = "system"});
//   if (!client) fail(client.error());
//   auto answer = client.value()->requestMetadata({.token = token, .requestedLocale = "en_US"});
//
// Each operation comes in a blocking form, which returns its Result, and an asynchronous form,
// whose callback runs exactly once on the client's own event thread (a thread with one bus
// connection and an sd-event loop, owned by the client). Every method may be called from any
// thread, callbacks included; a blocking call made from a callback holds up the other callbacks
// until it returns. Calls time out after ClientOptions::callTimeout, five minutes by default, since
// an operation may wait for a session to open. Destroying the client cancels the calls still
// unanswered: their callbacks get a Cancelled error. Callbacks must not throw.
//
// Arguments left out are not sent at all (see request_encoding.h); errors are described in
// client_error.h.
#pragma once

#include <systemd/sd-bus.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>

#include "client/client_error.h"
#include "client/reply_decoding.h"
#include "client/request_encoding.h"
#include "client/result.h"

namespace zlka_client {

class BusCaller;

struct ClientOptions {
  std::string bus = "system";  // "system", "session", or a D-Bus address such as "unix:path=/run/x"
  std::chrono::microseconds callTimeout = std::chrono::minutes(5);
};

class ZLKAClient {
 public:
  using MetadataCallback = std::function<void(Result<MetadataReply>)>;
  using ActivationCallback = std::function<void(Result<platform::Data>)>;
  using ConfirmationCallback = std::function<void(Result<Confirmation>)>;
  using RawCallback = std::function<void(Result<platform::Array>)>;
  // Appends all of a raw call's arguments to the message; a negative errno refuses the call.
  using ArgumentWriter = std::function<int(sd_bus_message* call)>;

  // Connects to the bus (not yet to the daemon, which is first reached by a call). Fails with
  // ConnectionFailed when the bus cannot be connected to.
  static Result<std::unique_ptr<ZLKAClient>> connect(const ClientOptions& options = {});
  ~ZLKAClient();
  ZLKAClient(const ZLKAClient&) = delete;
  ZLKAClient& operator=(const ZLKAClient&) = delete;

  // requestMetadata calls RequestMetadataForToken and waits for the ppid, locale identifier and
  // metadata, or fails with the operation's error or a client error (InvalidRequest for arguments
  // that cannot be sent, ServiceUnavailable, Refused, MalformedReply).
  Result<MetadataReply> requestMetadata(const MetadataArguments& arguments);
  // requestMetadataAsync returns at once; `callback` runs once, on the client's event thread, with
  // what requestMetadata would return. The same holds for each *Async below.
  void requestMetadataAsync(const MetadataArguments& arguments, MetadataCallback callback);

  // requestActivation calls RequestActivationForToken and waits for the new token, or fails as
  // requestMetadata does.
  Result<platform::Data> requestActivation(const TokenArguments& arguments);
  // requestActivationAsync is requestActivation with a callback on the event thread.
  void requestActivationAsync(const TokenArguments& arguments, ActivationCallback callback);

  // confirmActivation calls ConfirmActivationForToken and waits for its empty success, or fails as
  // requestMetadata does.
  Result<Confirmation> confirmActivation(const TokenArguments& arguments);
  // confirmActivationAsync is confirmActivation with a callback on the event thread.
  void confirmActivationAsync(const TokenArguments& arguments, ConfirmationCallback callback);

  // Any method of the daemon's interface with arguments written by `write` (for example an a{sv}
  // with a key of the wrong type); the answer's arguments as Values.
  Result<platform::Array> callRaw(const std::string& method, const ArgumentWriter& write);
  // callRawAsync is callRaw with a callback on the event thread.
  void callRawAsync(const std::string& method, ArgumentWriter write, RawCallback callback);

  // failAsync hands `error` to `callback` on the event thread, as for a call refused before it is
  // sent (arguments the caller's own types could not express).
  void failAsync(platform::Error error, MetadataCallback callback);

 private:
  explicit ZLKAClient(std::shared_ptr<BusCaller> caller) : caller_(std::move(caller)) {}
  std::shared_ptr<BusCaller> caller_;
};

}  // namespace zlka_client
