// libzlka-client: the three token operations of the zlkad daemon, called over D-Bus.
//
//   auto client = zlka::Client::connect({.bus = "system"});
//   if (!client) return fail(client.error());
//   auto plan = client.value()->requestMetadata({.token = token, .uuid = uuid, .requestedLocale = "en_US"});
//
// Link with `pkg-config --cflags --libs zlka-client`. Each operation comes in a blocking form,
// which returns its Result, and an asynchronous form, whose callback runs exactly once on the
// client's own event thread (one bus connection and an event loop, owned by the client). Every
// method may be called from any thread, callbacks included; a blocking call made from a callback
// holds up the other callbacks until it returns. Calls time out after ClientOptions::callTimeout,
// five minutes by default, since an operation may wait for the daemon to open a session.
// Destroying the client cancels the calls still unanswered: their callbacks get Cancelled.
// Callbacks must not throw.
//
// Errors: an operation's own failure comes back as the daemon made it, in kOperationErrorDomain
// with the daemon's code (-1 Unknown, -2 MissingEntitlement, -3 InvalidParameter, -4 Internal,
// -5 Network, -6 Server) and its description. Everything else (the bus cannot be reached, the
// daemon is absent or silent, a refusal by the bus, a malformed answer, arguments that cannot be
// sent) is in kClientErrorDomain with a ClientErrorCode.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#define ZLKA_CLIENT_EXPORT __attribute__((visibility("default")))

namespace zlka {

inline constexpr char kOperationErrorDomain[] = "ZLKATokenManagerErrorDomain";
inline constexpr char kClientErrorDomain[] = "ZLKAClientErrorDomain";

enum class ClientErrorCode : int64_t {
  ConnectionFailed = 1,    // the bus itself could not be connected to
  ServiceUnavailable = 2,  // the daemon is not on the bus, did not answer, or the connection dropped
  InvalidRequest = 3,      // the arguments cannot be sent (not UTF-8, request info not a JSON object, ...)
  Refused = 4,             // the bus or the daemon refused the call with a D-Bus error
  MalformedReply = 5,      // the answer does not have the form the method promises
  Cancelled = 6,           // the client was closed before the answer came
};

struct Error {
  std::string domain;
  int64_t code = 0;
  std::string description;
  std::string busErrorName;  // the D-Bus error name of a client error that came as one, else empty
};

// Either the value of a successful call or the Error it failed with.
template <class T>
class Result {
 public:
  // A Result converts from the value on success and from the Error on failure.
  Result(T value) : v_(std::in_place_index<0>, std::move(value)) {}
  Result(Error error) : v_(std::in_place_index<1>, std::move(error)) {}

  // ok, and the conversion to bool, are true on success.
  bool ok() const { return v_.index() == 0; }
  explicit operator bool() const { return ok(); }
  // value() only on success, error() only on failure (std::bad_variant_access otherwise).
  const T& value() const& { return std::get<0>(v_); }
  T& value() & { return std::get<0>(v_); }
  T&& value() && { return std::get<0>(std::move(v_)); }
  const Error& error() const { return std::get<1>(v_); }

 private:
  std::variant<T, Error> v_;
};

using Bytes = std::vector<uint8_t>;

// Arguments of requestActivation and confirmActivation. An argument left out is not sent; the
// daemon needs both.
struct TokenArguments {
  std::optional<Bytes> token = std::nullopt;
  std::optional<std::string> uuid = std::nullopt;
};

// Arguments of requestMetadata; the daemon needs token, uuid and requestedLocale.
struct MetadataArguments {
  std::optional<Bytes> token = std::nullopt;
  std::optional<std::string> uuid = std::nullopt;
  std::optional<std::string> requestedLocale = std::nullopt;  // a locale identifier such as "en_US"
  // A JSON object; no nulls, nesting at most 16 deep.
  std::optional<std::string> requestInfoJSON = std::nullopt;
};

struct Metadata {
  std::string ppid;
  std::string locale;        // the locale identifier the metadata is in
  std::string metadataJSON;  // compact JSON text, an object
};

struct Confirmation {};

struct ClientOptions {
  std::string bus = "system";  // "system", "session", or a D-Bus address such as "unix:path=/run/x"
  std::chrono::microseconds callTimeout = std::chrono::minutes(5);
};

class ZLKA_CLIENT_EXPORT Client {
 public:
  template <class T>
  using Callback = std::function<void(Result<T>)>;

  // connect returns a client connected to the bus (the daemon is first reached by a call), or
  // ConnectionFailed when the bus cannot be connected to. The caller owns the client.
  static Result<std::unique_ptr<Client>> connect(const ClientOptions& options = {});
  ~Client();
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  // requestMetadata asks for the token's product-plan id and its metadata in a locale; it returns
  // them, or the call's Error.
  Result<Metadata> requestMetadata(const MetadataArguments& arguments);
  // requestMetadataAsync calls `callback` once, on the client's thread, with what requestMetadata returns.
  void requestMetadataAsync(const MetadataArguments& arguments, Callback<Metadata> callback);

  // requestActivation activates the token for an accessory; it returns the replacement token, or the Error.
  Result<Bytes> requestActivation(const TokenArguments& arguments);
  // requestActivationAsync calls `callback` once, on the client's thread, with what requestActivation returns.
  void requestActivationAsync(const TokenArguments& arguments, Callback<Bytes> callback);

  // confirmActivation confirms an activation with the replacement token; it returns Confirmation, or the Error.
  Result<Confirmation> confirmActivation(const TokenArguments& arguments);
  // confirmActivationAsync calls `callback` once, on the client's thread, with what confirmActivation returns.
  void confirmActivationAsync(const TokenArguments& arguments, Callback<Confirmation> callback);

 private:
  class Impl;
  explicit Client(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;
};

}  // namespace zlka
