// Connection: one peer of the messaging service. Operations read the connection of the message
// being served with currentConnection(), a thread-local set while the message is handled, and ask
// it for the peer's entitlements. The listener works out who the peer is on the peer's own queue
// before any of its calls runs there, so a call always sees the peer's final entitlements.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/bus/messaging.h"
#include "platform/dispatch/queue.h"
#include "platform/values/value.h"

namespace platform {

// Answers the value of an entitlement for a peer, or nullopt when the peer does not hold it.
using EntitlementLookup = std::function<std::optional<Value>(std::string_view entitlement)>;

class Connection : public std::enable_shared_from_this<Connection> {
 public:
  // Connection represents the peer of unique name `peerName`; a null `entitlements` grants nothing.
  explicit Connection(std::string peerName, EntitlementLookup entitlements = nullptr);
  virtual ~Connection() = default;

  // peerName is the peer's unique bus name (":1.42"), borrowed from the connection.
  const std::string& peerName() const { return peerName_; }
  // valueForEntitlement answers the peer's value for an entitlement, or nullopt when the peer does
  // not hold it or its identity is not (yet) established.
  std::optional<Value> valueForEntitlement(std::string_view entitlement) const;
  // setEntitlementLookup installs how the peer's entitlements are read; null grants nothing.
  void setEntitlementLookup(EntitlementLookup lookup);

  // The interface and the object the peer's calls go to, set by the listener's delegate before
  // resume() and shared with the connection; the getters answer null until they are set.
  void setExportedInterface(std::shared_ptr<const Interface> interface);
  void setExportedObject(std::shared_ptr<void> object);
  // resume lets the peer's calls through; until then the listener refuses them (AccessDenied).
  void resume();
  std::shared_ptr<const Interface> exportedInterface() const;
  std::shared_ptr<void> exportedObject() const;
  // isResumed is true once resume() has been called.
  bool isResumed() const;

  // The serial queue this peer's calls run on (made on first use).
  std::shared_ptr<Queue> queue();

  // The connection whose message the calling thread is serving, or null.
  static Connection* currentConnection();

  // Makes a connection current on this thread for the lifetime of the scope.
  class CurrentScope {
   public:
    // CurrentScope makes `connection` (borrowed, may be null) current until the scope ends, then
    // restores the previous one.
    explicit CurrentScope(Connection* connection);
    ~CurrentScope();
    CurrentScope(const CurrentScope&) = delete;
    CurrentScope& operator=(const CurrentScope&) = delete;

   private:
    Connection* previous_;
  };

 private:
  std::string peerName_;
  EntitlementLookup entitlements_;
  mutable std::mutex mutex_;
  std::shared_ptr<const Interface> interface_;
  std::shared_ptr<void> object_;
  bool resumed_ = false;
  std::shared_ptr<Queue> queue_;
};

}  // namespace platform
