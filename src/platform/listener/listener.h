// Listener: the service side of the messaging service. configure() names the bus, the service
// name, the object and the interface to export; serviceListener() is the one listener of the
// process; resume() owns the bus and runs the event loop on the calling thread.
//
// resume() blocks SIGTERM, SIGINT and SIGHUP itself only on its own thread: call
// Listener::blockSignals() first thing in main, before any thread starts. SIGTERM and SIGINT drain:
// the name is released, calls still arriving are refused, calls in flight are answered (or failed
// when the drain limit passes), then resume() returns. SIGHUP runs the reload hook.
#pragma once

#include <systemd/sd-event.h>

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/bus/messaging.h"
#include "platform/listener/connection.h"
#include "platform/listener/entitlement_manifests.h"

namespace platform {

struct ListenerOptions {
  std::string bus = "system";  // "system", "session", or a bus address ("unix:path=...")
  std::string serviceName;
  std::string objectPath;
  std::shared_ptr<const Interface> interface;  // registered on the object
  // The entitlement lookup of a new peer, from the credentials the bus recorded for it. Runs once
  // per peer, on the peer's queue before any of its calls, so it may read /proc at leisure.
  std::function<EntitlementLookup(const PeerCredentials&)> entitlementsForPeer;
  std::function<void()> onReload;  // SIGHUP
  std::optional<std::chrono::seconds> exitOnIdle;
  std::chrono::seconds drainLimit{120};  // longest wait for calls in flight at shutdown
  // Calls of one peer worked on at once; its further calls wait in order, so a greedy peer cannot
  // take the workers, connections or memory that the others need.
  size_t maxCallsPerPeer = 8;
  bool notifyReady = true;  // READY=1 through sd_notify once the name is owned
  // Runs on the bus thread once the interface is exported, before the name is requested, with the
  // loop's bus and event loop, to add objects, properties and timers of the caller's own; what it
  // returns is kept until the loop ends.
  std::function<std::shared_ptr<void>(sd_bus* bus, sd_event* event)> onServing = nullptr;
};

class Listener {
 public:
  // configure stores the options the next resume() serves with; it checks nothing (resume does).
  static void configure(ListenerOptions options);
  // serviceListener is the process's one listener, made on first use and never destroyed.
  static Listener& serviceListener();
  // blockSignals blocks SIGTERM, SIGINT and SIGHUP on the calling thread, and so on every thread it
  // starts afterwards, so that only the event loop receives them.
  static void blockSignals();

  // setDelegate installs the delegate asked about each new peer; the listener shares it.
  void setDelegate(std::shared_ptr<ListenerDelegate> delegate);
  // delegate is the one installed, shared, or null.
  std::shared_ptr<ListenerDelegate> delegate() const;

  // Runs until shutdown; returns 0 after a clean stop, non-zero when the bus could not be used.
  int resume();
  // Starts the same drain as SIGTERM, from any thread.
  void stop();

  // connectionCount counts the peers connected now, callsInFlight the calls taken on and not yet
  // answered; both are 0 before resume().
  size_t connectionCount() const;
  size_t callsInFlight() const;

  class Core;

 private:
  Listener() = default;
  std::shared_ptr<Core> core_;
  std::shared_ptr<ListenerDelegate> delegate_;
  mutable std::mutex mutex_;
};

}  // namespace platform
