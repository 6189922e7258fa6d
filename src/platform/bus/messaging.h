// Local messaging over D-Bus (sd-bus and sd-event).
//
// One Listener owns the bus connection and its event loop, on one thread; nothing else touches
// sd-bus. A method call is decoded on that thread (type errors are answered there, before any
// operation runs), then handed to the calling peer's Connection, whose serial queue runs it with
// Connection::currentConnection() set. Replies may be sent from any thread; they travel back to the
// bus thread through a queue. Every call gets exactly one reply: a Reply that is dropped unsent
// answers with an error rather than leaving the caller waiting.
#pragma once

#include <systemd/sd-bus.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace platform {

class Connection;
class Listener;

// A D-Bus error to answer with: name and message.
struct BusError {
  std::string name;
  std::string message;
};

inline constexpr char kBusErrorInvalidArgs[] = "org.freedesktop.DBus.Error.InvalidArgs";
inline constexpr char kBusErrorAccessDenied[] = "org.freedesktop.DBus.Error.AccessDenied";
inline constexpr char kBusErrorFailed[] = "org.freedesktop.DBus.Error.Failed";
inline constexpr char kBusErrorNoServer[] = "org.freedesktop.DBus.Error.NoServer";

// The one answer to one method call. Thread-safe; the first send or fail wins.
class Reply {
 public:
  // Appends the out arguments to the reply message; runs on the bus thread.
  using Writer = std::function<int(sd_bus_message* reply)>;
  struct State;

  // Reply shares the call's state; the listener makes one per call taken on.
  explicit Reply(std::shared_ptr<State> state) : state_(std::move(state)) {}
  // send answers the call with what `writer` appends, fail with `error`; after the first answer
  // both do nothing. When the bus thread can no longer take the answer, the call is answered with
  // org.freedesktop.DBus.Error.Failed once the last copy of the Reply goes.
  void send(Writer writer) const;
  void fail(BusError error) const;

 private:
  std::shared_ptr<State> state_;
};

// Decoding of a call's arguments, on the bus thread: either the work to run on the connection's
// queue, or an error to answer at once.
using MethodInvocation = std::function<void(Reply reply)>;
struct DecodedCall {
  MethodInvocation invocation;
  std::optional<BusError> error;
};
// `exportedObject` is the connection's exported object (the adaptor knows its type).
using MethodDecoder = std::function<DecodedCall(sd_bus_message* message, const std::shared_ptr<void>& exportedObject)>;

struct InterfaceMethod {
  std::string name;
  std::string inSignature;
  std::string outSignature;
  std::vector<std::string> inNames;
  std::vector<std::string> outNames;
  MethodDecoder decode;
};

// The exported interface: a D-Bus interface name and its methods.
struct Interface {
  std::string name;
  std::vector<InterfaceMethod> methods;
};

class ListenerDelegate {
 public:
  virtual ~ListenerDelegate() = default;
  // Called on the bus thread for the first message of each new peer.
  virtual bool listenerShouldAcceptNewConnection(Listener& listener, Connection& connection) = 0;
};

}  // namespace platform
