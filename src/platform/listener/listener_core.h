// The listener's core: the run loop (listener.cpp) and the bus endpoint (listener_endpoint.cpp),
// wiring the peer table (peer_table.h), the call ledger (call_ledger.h) and the mailbox through
// which other threads reach the bus thread (loop_mailbox.h). Private to the listener; everything
// here runs on the bus thread unless a member says otherwise.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <atomic>
#include <vector>

#include "platform/bus/handles.h"
#include "platform/bus/loop_mailbox.h"
#include "platform/listener/call_ledger.h"
#include "platform/listener/guarded.h"
#include "platform/listener/listener.h"
#include "platform/listener/peer_table.h"
#include "platform/log/log.h"

struct signalfd_siginfo;

namespace platform {

// A call's side of its Reply: the call itself stays in the ledger, on the bus thread.
struct Reply::State {
  std::weak_ptr<Listener::Core> core;
  uint64_t id = 0;  // in the ledger; zero until the call is taken on
  std::atomic<bool> done{false};
  ~State();
};

class Listener::Core : public std::enable_shared_from_this<Listener::Core> {
 public:
  // Core serves with `options` on behalf of `owner`, which must outlive it; nothing runs until run().
  Core(ListenerOptions options, Listener& owner)
      : options_(std::move(options)), peers_(owner, options_.entitlementsForPeer, options_.maxCallsPerPeer) {}

  // Run loop: serves until a drain ends; returns 0 after a clean stop, 1 when the bus cannot be used.
  int run();
  // Runs `work` on the bus thread, from any thread. Returns false, with `work` dropped unrun, once
  // the loop has ended or when memory ran out.
  bool post(LoopMailbox::Work work) noexcept { return mailbox_.post(std::move(work)); }
  // requestStop begins the drain on the bus thread, as SIGTERM does; nothing when the loop has ended.
  void requestStop();
  // The peers connected and the calls taken on and not yet answered; safe from any thread.
  size_t connectionCount() const { return peers_.count(); }
  size_t callsInFlight() const { return ledger_.open(); }

  // The answer to call `id` (or its error) through the ledger, then the peer's next call; a call
  // already answered is left alone.
  void sendReturn(uint64_t id, const Reply::Writer& writer);
  void sendError(uint64_t id, const BusError& error);

 private:
  // Endpoint: the bus, the exported object and the calls that come in.
  int openBus();
  void buildVTable();
  static int onMethodCall(sd_bus_message* m, void* userdata, sd_bus_error*) noexcept;
  int dispatch(sd_bus_message* m);
  void finishCall(const std::string& peer);

  // Run loop.
  static int onSignal(sd_event_source*, const struct signalfd_siginfo* info, void* userdata);
  void beginDrain(const std::string& why);
  static int onDrainLimit(sd_event_source*, uint64_t, void* userdata);
  void armIdleTimer(uint64_t at);
  static int onIdleTimer(sd_event_source*, uint64_t, void* userdata);
  uint64_t now() const;
  static uint64_t toUsec(std::chrono::seconds s) { return static_cast<uint64_t>(s.count()) * 1000000u; }
  int fail(const std::string& what, int rc);
  // Adds an event source of this core and keeps it until the core goes.
  template <class Add, class... A>
  int addSource(Add add, A... arguments) {
    sd_event_source* source = nullptr;
    int rc = add(event_.get(), &source, arguments..., this);
    if (rc >= 0) sources_.emplace_back(source);
    return rc;
  }

  ListenerOptions options_;
  // Declared in the order they depend on each other, so that they are released in reverse.
  EventPtr event_;
  BusPtr bus_;
  LoopMailbox mailbox_;
  std::vector<sd_bus_vtable> vtable_;  // read by sd-bus until vtableSlot_ goes
  std::vector<std::string> names_;
  BusSlotPtr vtableSlot_;
  std::shared_ptr<void> serving_;         // what options_.onServing made
  sd_event_source* idleTimer_ = nullptr;  // one of sources_
  std::vector<EventSourcePtr> sources_;
  PeerTable peers_;
  CallLedger ledger_;
  uint64_t lastActivity_ = 0;
  bool draining_ = false;
};

}  // namespace platform
