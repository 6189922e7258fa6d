// The listener's core, shared by the files that implement it by concern: the run loop
// (listener.cpp), the bus endpoint and its call ledger (listener_endpoint.cpp) and the peer table
// (listener_peers.cpp). Private to the listener; everything here runs on the bus thread unless a
// member says otherwise.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <atomic>
#include <deque>
#include <map>
#include <mutex>
#include <vector>

#include "platform/handles.h"
#include "platform/listener.h"
#include "platform/log.h"

struct signalfd_siginfo;

namespace platform {

// sd-bus and sd-event call back through C, where no exception may pass: a handler that runs out
// of a resource logs it and the loop serves on.
template <auto Handler>
struct Guarded;
template <class R, class... A, R (*Handler)(A...)>
struct Guarded<Handler> {
  static R call(A... arguments) noexcept {
    try {
      return Handler(arguments...);
    } catch (const std::exception& e) {
      log(LogLevel::Error,
          "Messaging: a handler failed: {'run': 'int run();', 'post': 'void post(std::function<void()> work) "
          "noexcept;', 'requestStop': 'void requestStop();', 'sendReturn': 'void sendReturn(sd_bus_message* call, "
          "const Reply::Writer& writer, uint64_t id);', 'sendError': 'void sendError(sd_bus_message* call, const "
          "BusError& error, uint64_t id);', 'memberOf': 'static std::string memberOf(sd_bus_message* m);', 'now': "
          "'uint64_t now() const;', 'fail': 'int fail(const std::string& what, int rc);', 'openBus': 'int openBus();', "
          "'buildVTable': 'void buildVTable();', 'sendErrorNow': 'void sendErrorNow(sd_bus_message* call, const "
          "BusError& error);', 'finishCall': 'void finishCall(uint64_t id);', 'pump': 'void pump(Peer& peer);', "
          "'peerFor': 'Peer& peerFor(const std::string& sender);', 'onCredentials': 'static int "
          "onCredentials(sd_bus_message* reply, void* userdata, sd_bus_error*);', 'identify': 'void identify(Peer& "
          "peer, sd_bus_message* credentialsReply, const std::string& error);', 'parseCredentials': 'static "
          "std::optional<PeerCredentials> parseCredentials(sd_bus_message* reply);', 'schedule': 'static void "
          "schedule(const std::shared_ptr<Connection>& connection, MethodInvocation invocation, Reply reply);', "
          "'onMethodCall': 'static int onMethodCall(sd_bus_message* m, void* userdata, sd_bus_error*) noexcept;', "
          "'dispatch': 'int dispatch(sd_bus_message* m);', 'onNameOwnerChanged': 'static int "
          "onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error*);', 'onPosted': 'static int "
          "onPosted(sd_event_source*, int fd, uint32_t, void* userdata);', 'onSignal': 'static int "
          "onSignal(sd_event_source*, const struct signalfd_siginfo* info, void* userdata);', 'beginDrain': 'void "
          "beginDrain(const std::string& why);', 'onDrainLimit': 'static int onDrainLimit(sd_event_source*, uint64_t, "
          "void* userdata);', 'armIdleTimer': 'void armIdleTimer(uint64_t at);', 'onIdleTimer': 'static int "
          "onIdleTimer(sd_event_source*, uint64_t, void* userdata);'}",
          e.what());
    } catch (...) {
      log(LogLevel::Error, "Messaging: a handler failed");
    }
    return R{};
  }
};

struct Reply::State {
  std::weak_ptr<Listener::Core> core;
  sd_bus_message* call = nullptr;  // referenced; touched on the bus thread only
  uint64_t id = 0;
  std::atomic<bool> done{false};
  ~State();
};

class Listener::Core : public std::enable_shared_from_this<Listener::Core> {
 public:
  Core(ListenerOptions options, Listener& owner) : options_(std::move(options)), owner_(owner) {}

  // Run loop: serves until a drain ends; returns 0 after a clean stop, 1 when the bus cannot be used.
  int run();
  // Runs `work` on the bus thread, from any thread; drops it only for want of memory.
  void post(std::function<void()> work) noexcept;
  void requestStop();
  size_t connectionCount() const { return connectionCount_.load(); }
  size_t callsInFlight() const { return inFlight_.load(); }

  // Call ledger: the answer to a call (or its error), then its bookkeeping.
  void sendReturn(sd_bus_message* call, const Reply::Writer& writer, uint64_t id);
  void sendError(sd_bus_message* call, const BusError& error, uint64_t id);

 private:
  // Peer table: who a peer is, and its calls waiting in order (until the bus has said who it is,
  // then while it has as many calls worked on as it may).
  struct CredentialsRequest {
    Core* core;
    std::string peer;
  };
  struct Peer {
    std::shared_ptr<Connection> connection;  // null: refused by the delegate
    std::unique_ptr<CredentialsRequest> request;
    BusSlotPtr credentialsCall;  // declared after `request`, so released before it
    std::deque<std::pair<MethodInvocation, Reply>> backlog;
    size_t working = 0;
    bool identified = false;
  };
  Peer& peerFor(const std::string& sender);
  static int onCredentials(sd_bus_message* reply, void* userdata, sd_bus_error*);
  void identify(Peer& peer, sd_bus_message* credentialsReply, const std::string& error);
  static std::optional<PeerCredentials> parseCredentials(sd_bus_message* reply);
  void pump(Peer& peer);
  static void schedule(const std::shared_ptr<Connection>& connection, MethodInvocation invocation, Reply reply);
  static int onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error*);

  // Endpoint: the bus, the exported object and the calls that come in.
  int openBus();
  void buildVTable();
  static int onMethodCall(sd_bus_message* m, void* userdata, sd_bus_error*) noexcept;
  int dispatch(sd_bus_message* m);
  void sendErrorNow(sd_bus_message* call, const BusError& error);
  void finishCall(uint64_t id);
  static std::string memberOf(sd_bus_message* m);

  // Run loop.
  static int onPosted(sd_event_source*, int fd, uint32_t, void* userdata);
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
  Listener& owner_;
  // Declared in the order they depend on each other, so that they are released in reverse.
  EventPtr event_;
  BusPtr bus_;
  UniqueFd wakeFd_;
  std::vector<sd_bus_vtable> vtable_;  // read by sd-bus until vtableSlot_ goes
  std::vector<std::string> names_;
  BusSlotPtr vtableSlot_;
  BusSlotPtr matchSlot_;
  sd_event_source* idleTimer_ = nullptr;  // one of sources_
  std::vector<EventSourcePtr> sources_;
  std::mutex postMutex_;
  std::vector<std::function<void()>> posted_;
  std::map<std::string, Peer> peers_;
  std::atomic<size_t> connectionCount_{0};
  struct PendingCall {
    std::weak_ptr<Reply::State> state;
    std::string peer;  // unique bus name
  };
  std::map<uint64_t, PendingCall> pending_;
  std::atomic<size_t> inFlight_{0};
  uint64_t nextId_ = 0;
  uint64_t lastActivity_ = 0;
  bool draining_ = false;
};

}  // namespace platform
