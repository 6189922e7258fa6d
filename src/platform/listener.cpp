#include "platform/listener.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <systemd/sd-daemon.h>
#include <systemd/sd-event.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <deque>
#include <map>
#include <set>
#include <vector>

#include "platform/handles.h"
#include "platform/log.h"

namespace platform {

namespace {
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
      log(LogLevel::Error, "Messaging: a handler failed: %s", e.what());
    } catch (...) {
      log(LogLevel::Error, "Messaging: a handler failed");
    }
    return R{};
  }
};

ListenerOptions& configuredOptions() {
  static ListenerOptions options;
  return options;
}

}  // namespace

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

  int run() {
    if (!options_.interface) {
      log(LogLevel::Fault, "The listener has no interface to export");
      return 1;
    }
    sd_event* event = nullptr;
    int rc = sd_event_new(&event);
    if (rc < 0) return fail("cannot create the event loop", rc);
    event_.reset(event);
    rc = openBus();
    if (rc < 0) return fail("cannot connect to the " + options_.bus + " bus", rc);
    rc = sd_bus_attach_event(bus_.get(), event_.get(), SD_EVENT_PRIORITY_NORMAL);
    if (rc < 0) return fail("cannot attach the bus to the event loop", rc);
    wakeFd_.reset(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!wakeFd_) return fail("cannot create an eventfd", -errno);
    if ((rc = addSource(sd_event_add_io, wakeFd_.get(), EPOLLIN, &Guarded<&Core::onPosted>::call)) < 0)
      return fail("cannot watch the eventfd", rc);
    for (int sig : {SIGTERM, SIGINT, SIGHUP})
      if ((rc = addSource(sd_event_add_signal, sig, &Guarded<&Core::onSignal>::call)) < 0)
        return fail("cannot handle signals (call Listener::blockSignals() first)", rc);
    buildVTable();
    sd_bus_slot* slot = nullptr;
    rc = sd_bus_add_object_vtable(bus_.get(), &slot, options_.objectPath.c_str(), options_.interface->name.c_str(),
                                  vtable_.data(), this);
    vtableSlot_.reset(slot);
    if (rc < 0) return fail("cannot export " + options_.objectPath, rc);
    rc = sd_bus_match_signal(bus_.get(), &slot, "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
                             "NameOwnerChanged", &Guarded<&Core::onNameOwnerChanged>::call, this);
    matchSlot_.reset(slot);
    if (rc < 0) return fail("cannot watch peers leaving the bus", rc);
    rc = sd_bus_request_name(bus_.get(), options_.serviceName.c_str(), 0);
    if (rc < 0) return fail("cannot own the name " + options_.serviceName, rc);
    lastActivity_ = now();
    if (options_.exitOnIdle) armIdleTimer(lastActivity_ + toUsec(*options_.exitOnIdle));
    log(LogLevel::Default, "Listening as %s on %s at %s", options_.serviceName, options_.bus, options_.objectPath);
    if (options_.notifyReady) sd_notify(0, "READY=1\nSTATUS=Serving requests");
    rc = sd_event_loop(event_.get());
    if (options_.notifyReady) sd_notify(0, "STOPPING=1");
    return rc < 0 ? 1 : rc;
  }

  // Runs `work` on the bus thread.
  // Runs `work` on the bus thread. Fails only for want of memory, and then drops the work.
  void post(std::function<void()> work) noexcept {
    try {
      std::lock_guard lock(postMutex_);
      posted_.push_back(std::move(work));
    } catch (const std::exception& e) {
      log(LogLevel::Error, "Messaging: cannot hand work to the bus thread: %s", e.what());
      return;
    }
    uint64_t one = 1;
    if (::write(wakeFd_.get(), &one, sizeof one) < 0) {
      // The counter saturating still wakes the loop; nothing else can go wrong here.
    }
  }

  void requestStop() {
    post([self = shared_from_this()] { self->beginDrain("stop requested"); });
  }

  size_t connectionCount() const { return connectionCount_.load(); }
  size_t callsInFlight() const { return inFlight_.load(); }

  // Bus thread: the answer to a call, then its bookkeeping.
  void sendReturn(sd_bus_message* call, const Reply::Writer& writer, uint64_t id) {
    sd_bus_message* made = nullptr;
    int rc = sd_bus_message_new_method_return(call, &made);
    BusMessagePtr reply(made);
    if (rc >= 0 && writer) rc = writer(reply.get());
    if (rc >= 0) rc = sd_bus_send(bus_.get(), reply.get(), nullptr);
    if (rc < 0) {
      log(LogLevel::Error, "Could not encode the answer to %s: %s", memberOf(call), std::string(strerror(-rc)));
      sendErrorNow(call, BusError{kBusErrorFailed, "The answer could not be encoded."});
    }
    sd_bus_message_unref(call);
    finishCall(id);
  }

  void sendError(sd_bus_message* call, const BusError& error, uint64_t id) {
    sendErrorNow(call, error);
    sd_bus_message_unref(call);
    finishCall(id);
  }

 private:
  static std::string memberOf(sd_bus_message* m) {
    const char* member = sd_bus_message_get_member(m);
    return member ? member : "?";
  }

  uint64_t now() const {
    uint64_t t = 0;
    sd_event_now(event_.get(), CLOCK_MONOTONIC, &t);
    return t;
  }
  static uint64_t toUsec(std::chrono::seconds s) { return static_cast<uint64_t>(s.count()) * 1000000u; }

  int fail(const std::string& what, int rc) {
    log(LogLevel::Fault, "Messaging: %s: %s", what, std::string(strerror(-rc)));
    return 1;
  }

  int openBus() {
    sd_bus* bus = nullptr;
    int rc = options_.bus == "system"    ? sd_bus_open_system(&bus)
             : options_.bus == "session" ? sd_bus_open_user(&bus)
                                         : sd_bus_new(&bus);
    bus_.reset(bus);
    if (rc < 0 || options_.bus == "system" || options_.bus == "session") return rc;
    if ((rc = sd_bus_set_address(bus_.get(), options_.bus.c_str())) < 0) return rc;
    if ((rc = sd_bus_set_bus_client(bus_.get(), 1)) < 0) return rc;
    return sd_bus_start(bus_.get());
  }

  // Adds an event source of this core and keeps it until the core goes.
  template <class Add, class... A>
  int addSource(Add add, A... arguments) {
    sd_event_source* source = nullptr;
    int rc = add(event_.get(), &source, arguments..., this);
    if (rc >= 0) sources_.emplace_back(source);
    return rc;
  }

  void buildVTable() {
    sd_bus_vtable start{};
    start.type = _SD_BUS_VTABLE_START;
    start.flags = 0;
    start.x.start.element_size = sizeof(sd_bus_vtable);
    start.x.start.features = _SD_BUS_VTABLE_PARAM_NAMES;
    start.x.start.vtable_format_reference = &sd_bus_object_vtable_format;
    vtable_.push_back(start);
    for (const InterfaceMethod& m : options_.interface->methods) {
      std::string names;
      for (const auto& n : m.inNames) names.append(n).push_back('\0');
      for (const auto& n : m.outNames) names.append(n).push_back('\0');
      names_.push_back(std::move(names));
    }
    size_t i = 0;
    for (const InterfaceMethod& m : options_.interface->methods) {
      sd_bus_vtable v{};
      v.type = _SD_BUS_VTABLE_METHOD;
      // Admission is the operations' business (entitlements) and the bus policy's, not sd-bus's.
      v.flags = SD_BUS_VTABLE_UNPRIVILEGED;
      v.x.method.member = m.name.c_str();
      v.x.method.signature = m.inSignature.c_str();
      v.x.method.result = m.outSignature.c_str();
      v.x.method.handler = &Core::onMethodCall;
      v.x.method.offset = 0;
      v.x.method.names = names_[i++].c_str();
      vtable_.push_back(v);
    }
    sd_bus_vtable end{};
    end.type = _SD_BUS_VTABLE_END;
    vtable_.push_back(end);
  }

  void sendErrorNow(sd_bus_message* call, const BusError& error) {
    sd_bus_error e{};  // no error yet
    sd_bus_error_set(&e, error.name.c_str(), error.message.c_str());
    sd_bus_reply_method_error(call, &e);
    sd_bus_error_free(&e);
  }

  void finishCall(uint64_t id) {
    if (auto call = pending_.find(id); call != pending_.end()) {
      if (auto peer = peers_.find(call->second.peer); peer != peers_.end()) {
        --peer->second.working;
        pump(peer->second);
      }
      pending_.erase(call);
    }
    inFlight_.fetch_sub(1);
    lastActivity_ = now();
    if (draining_ && inFlight_.load() == 0) sd_event_exit(event_.get(), 0);
  }

  // A peer's calls wait in order in its backlog until the bus has said who it is, and then while
  // it has as many calls being worked on as it may.
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

  void pump(Peer& peer) {
    while (peer.identified && peer.working < options_.maxCallsPerPeer && !peer.backlog.empty()) {
      auto& [invocation, reply] = peer.backlog.front();
      schedule(peer.connection, std::move(invocation), std::move(reply));
      peer.backlog.pop_front();
      ++peer.working;
    }
  }

  // The peer's entry, made at its first message. Nothing is recorded when making it fails (the
  // delegate may run out of threads or memory), so that the peer's next message tries again.
  Peer& peerFor(const std::string& sender) {
    auto it = peers_.find(sender);
    if (it != peers_.end()) return it->second;
    Peer made;
    auto connection = std::make_shared<Connection>(sender);
    std::shared_ptr<ListenerDelegate> delegate = owner_.delegate();
    if (delegate && delegate->listenerShouldAcceptNewConnection(owner_, *connection))
      made.connection = std::move(connection);
    if (made.connection) made.request = std::make_unique<CredentialsRequest>(CredentialsRequest{this, sender});
    Peer& peer = peers_.emplace(sender, std::move(made)).first->second;
    connectionCount_.store(peers_.size());
    if (!peer.connection) return peer;
    // Asked once, without waiting: the answer comes back to this thread like any other message.
    sd_bus_slot* slot = nullptr;
    int rc = sd_bus_call_method_async(bus_.get(), &slot, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                                      "org.freedesktop.DBus", "GetConnectionCredentials",
                                      &Guarded<&Core::onCredentials>::call, peer.request.get(), "s", sender.c_str());
    peer.credentialsCall.reset(slot);
    if (rc < 0) identify(peer, nullptr, std::string(strerror(-rc)));
    return peer;
  }

  static int onCredentials(sd_bus_message* reply, void* userdata, sd_bus_error*) {
    auto* request = static_cast<CredentialsRequest*>(userdata);
    auto it = request->core->peers_.find(request->peer);
    if (it == request->core->peers_.end()) return 0;
    const sd_bus_error* error = sd_bus_message_get_error(reply);
    request->core->identify(it->second, error ? nullptr : reply, error && error->message ? error->message : "");
    return 0;
  }

  // Bus thread: the peer's identity is worked out first on its own queue (reading /proc may be
  // slow), then its waiting calls follow in order. Without credentials it holds no entitlements.
  void identify(Peer& peer, sd_bus_message* credentialsReply, const std::string& error) {
    auto credentials = std::make_shared<std::optional<PeerCredentials>>();
    if (credentialsReply) *credentials = parseCredentials(credentialsReply);
    if (!*credentials)
      log(LogLevel::Error, "No credentials for peer %s%s%s: it holds no entitlements", peer.connection->peerName(),
          error.empty() ? "" : ": ", error);
    else if (options_.entitlementsForPeer)
      peer.connection->queue()->async(
          [connection = peer.connection, credentials, identify = options_.entitlementsForPeer] {
            connection->setEntitlementLookup(identify(**credentials));
          });
    peer.identified = true;
    pump(peer);
  }

  static std::optional<PeerCredentials> parseCredentials(sd_bus_message* reply) {
    PeerCredentials c;
    bool haveUid = false, havePid = false;
    if (sd_bus_message_enter_container(reply, 'a', "{sv}") <= 0) return std::nullopt;
    while (sd_bus_message_enter_container(reply, 'e', "sv") > 0) {
      const char* key = nullptr;
      if (sd_bus_message_read_basic(reply, 's', &key) <= 0) return std::nullopt;
      std::string_view k = key;
      if (k == "UnixUserID" && sd_bus_message_enter_container(reply, 'v', "u") > 0) {
        uint32_t v = 0;
        haveUid = sd_bus_message_read_basic(reply, 'u', &v) > 0;
        c.uid = v;
        sd_bus_message_exit_container(reply);
      } else if (k == "ProcessID" && sd_bus_message_enter_container(reply, 'v', "u") > 0) {
        uint32_t v = 0;
        havePid = sd_bus_message_read_basic(reply, 'u', &v) > 0;
        c.pid = static_cast<pid_t>(v);
        sd_bus_message_exit_container(reply);
      } else if (k == "LinuxSecurityLabel" && sd_bus_message_enter_container(reply, 'v', "ay") > 0) {
        const void* bytes = nullptr;
        size_t size = 0;
        if (sd_bus_message_read_array(reply, 'y', &bytes, &size) > 0) {
          std::string label(static_cast<const char*>(bytes), size);
          while (!label.empty() && label.back() == '\0') label.pop_back();
          if (!label.empty()) c.label = std::move(label);
        }
        sd_bus_message_exit_container(reply);
      } else if (k == "ProcessFD" && sd_bus_message_enter_container(reply, 'v', "h") > 0) {
        int fd = -1;
        if (sd_bus_message_read_basic(reply, 'h', &fd) > 0 && fd >= 0) c.pidfd.reset(fcntl(fd, F_DUPFD_CLOEXEC, 3));
        sd_bus_message_exit_container(reply);
      } else {
        sd_bus_message_skip(reply, "v");
      }
      sd_bus_message_exit_container(reply);
    }
    if (!haveUid || !havePid) return std::nullopt;
    return c;
  }

  // Runs a call on its peer's queue, with the peer's connection current.
  static void schedule(const std::shared_ptr<Connection>& connection, MethodInvocation invocation, Reply reply) {
    connection->queue()->async([connection, invocation = std::move(invocation), reply = std::move(reply)] {
      Connection::CurrentScope scope(connection.get());
      try {
        invocation(reply);
      } catch (const std::exception& e) {
        reply.fail(BusError{kBusErrorFailed, std::string("The operation failed: ") + e.what()});
      }
    });
  }

  static int onMethodCall(sd_bus_message* m, void* userdata, sd_bus_error*) noexcept {
    auto* self = static_cast<Core*>(userdata);
    try {
      return self->dispatch(m);
    } catch (const std::exception& e) {
      // Before its reply state exists (dispatch's last step), a call is answered here.
      log(LogLevel::Error, "Cannot serve a call to %s: %s", memberOf(m), e.what());
      self->sendErrorNow(m, BusError{kBusErrorFailed, "The service is short of resources; try again."});
    }
    return 1;
  }

  int dispatch(sd_bus_message* m) {
    const char* senderRaw = sd_bus_message_get_sender(m);
    std::string member = memberOf(m);
    if (draining_) {
      sendErrorNow(m, BusError{kBusErrorNoServer, "The service is shutting down."});
      return 1;
    }
    if (!senderRaw) {
      sendErrorNow(m, BusError{kBusErrorAccessDenied, "Calls must come through the bus."});
      return 1;
    }
    Peer& peer = peerFor(senderRaw);
    std::shared_ptr<Connection> connection = peer.connection;
    if (!connection || !connection->isResumed()) {
      sendErrorNow(m, BusError{kBusErrorAccessDenied, "The connection was not accepted."});
      return 1;
    }
    std::shared_ptr<const Interface> interface = connection->exportedInterface();
    const InterfaceMethod* method = nullptr;
    if (interface)
      for (const auto& candidate : interface->methods)
        if (candidate.name == member) method = &candidate;
    if (!method) {
      sendErrorNow(m,
                   BusError{"org.freedesktop.DBus.Error.UnknownMethod", "No method " + member + " is exported here."});
      return 1;
    }
    DecodedCall decoded;
    try {
      decoded = method->decode(m, connection->exportedObject());
    } catch (const std::exception& e) {
      decoded.error = BusError{kBusErrorFailed, std::string("The call could not be decoded: ") + e.what()};
    }
    if (decoded.error || !decoded.invocation) {
      sendErrorNow(m, decoded.error.value_or(BusError{kBusErrorFailed, "The call could not be decoded."}));
      return 1;
    }
    auto state = std::make_shared<Reply::State>();
    state->core = weak_from_this();
    state->id = ++nextId_;
    pending_.emplace(state->id, PendingCall{state, senderRaw});
    // From here on the call is answered exactly once through its state: dropped unanswered (as
    // when it cannot be queued for want of memory), the state answers with an error itself.
    state->call = sd_bus_message_ref(m);
    inFlight_.fetch_add(1);
    lastActivity_ = now();
    Reply reply(state);
    try {
      peer.backlog.emplace_back(std::move(decoded.invocation), reply);
      pump(peer);
    } catch (const std::exception& e) {
      log(LogLevel::Error, "Cannot queue a call to %s: %s", member, e.what());
    }
    return 1;
  }

  static int onNameOwnerChanged(sd_bus_message* m, void* userdata, sd_bus_error*) {
    auto* self = static_cast<Core*>(userdata);
    const char *name = nullptr, *oldOwner = nullptr, *newOwner = nullptr;
    if (sd_bus_message_read(m, "sss", &name, &oldOwner, &newOwner) < 0) return 0;
    // A unique name never comes back: its connection ends with it. Work already queued finishes.
    if (name && name[0] == ':' && newOwner && !*newOwner) {
      self->peers_.erase(name);
      self->connectionCount_.store(self->peers_.size());
    }
    return 0;
  }

  static int onPosted(sd_event_source*, int fd, uint32_t, void* userdata) {
    auto* self = static_cast<Core*>(userdata);
    uint64_t count = 0;
    if (::read(fd, &count, sizeof count) < 0) {
      // Spurious wake-up: nothing to read, nothing to do.
    }
    std::vector<std::function<void()>> work;
    {
      std::lock_guard lock(self->postMutex_);
      work.swap(self->posted_);
    }
    for (auto& w : work) {
      try {
        w();
      } catch (const std::exception& e) {
        log(LogLevel::Error, "Messaging: work on the bus thread failed: %s", e.what());
      }
    }
    return 0;
  }

  static int onSignal(sd_event_source*, const struct signalfd_siginfo* info, void* userdata) {
    auto* self = static_cast<Core*>(userdata);
    if (info->ssi_signo == SIGHUP) {
      log(LogLevel::Default, "Reloading on SIGHUP");
      if (self->options_.onReload) self->options_.onReload();
      return 0;
    }
    self->beginDrain(info->ssi_signo == SIGTERM ? "SIGTERM" : "SIGINT");
    return 0;
  }

  void beginDrain(const std::string& why) {
    if (draining_) return;
    draining_ = true;
    log(LogLevel::Default, "Shutting down (%s) with %zu call(s) in flight", why, inFlight_.load());
    if (options_.notifyReady) sd_notify(0, "STOPPING=1");
    sd_bus_release_name(bus_.get(), options_.serviceName.c_str());
    if (inFlight_.load() == 0) {
      sd_event_exit(event_.get(), 0);
      return;
    }
    addSource(sd_event_add_time_relative, CLOCK_MONOTONIC, toUsec(options_.drainLimit), uint64_t{0},
              &Guarded<&Core::onDrainLimit>::call);
  }

  static int onDrainLimit(sd_event_source*, uint64_t, void* userdata) {
    auto* self = static_cast<Core*>(userdata);
    log(LogLevel::Error, "Calls still in flight after the drain limit: failing %zu of them", self->pending_.size());
    for (auto& [id, call] : self->pending_)
      if (auto state = call.state.lock(); state && !state->done.exchange(true)) {
        self->sendErrorNow(state->call,
                           BusError{kBusErrorNoServer, "The service shut down before the operation finished."});
        sd_bus_message_unref(state->call);
        state->call = nullptr;
      }
    self->pending_.clear();
    sd_event_exit(self->event_.get(), 0);
    return 0;
  }

  void armIdleTimer(uint64_t at) {
    if (!idleTimer_) {
      if (addSource(sd_event_add_time, CLOCK_MONOTONIC, at, uint64_t{0}, &Guarded<&Core::onIdleTimer>::call) >= 0)
        idleTimer_ = sources_.back().get();
      return;
    }
    sd_event_source_set_time(idleTimer_, at);
    sd_event_source_set_enabled(idleTimer_, SD_EVENT_ONESHOT);
  }

  static int onIdleTimer(sd_event_source*, uint64_t, void* userdata) {
    auto* self = static_cast<Core*>(userdata);
    uint64_t limit = toUsec(*self->options_.exitOnIdle);
    uint64_t t = self->now();
    if (self->inFlight_.load() == 0 && t - self->lastActivity_ >= limit) {
      self->beginDrain("idle");
      return 0;
    }
    self->armIdleTimer(std::max(self->lastActivity_, t) + limit);
    return 0;
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

Reply::State::~State() {
  if (done.exchange(true) || !call) return;
  // Dropped without an answer: the caller still gets one.
  if (auto c = core.lock()) {
    c->post([c, call = call, id = id] {
      c->sendError(call, BusError{kBusErrorFailed, "The operation ended without an answer."}, id);
    });
  }
}

void Reply::send(Writer writer) const {
  if (state_->done.exchange(true)) return;
  if (auto core = state_->core.lock())
    core->post([core, call = state_->call, writer = std::move(writer), id = state_->id] {
      core->sendReturn(call, writer, id);
    });
}

void Reply::fail(BusError error) const {
  if (state_->done.exchange(true)) return;
  if (auto core = state_->core.lock())
    core->post(
        [core, call = state_->call, error = std::move(error), id = state_->id] { core->sendError(call, error, id); });
}

void Listener::configure(ListenerOptions options) { configuredOptions() = std::move(options); }

Listener& Listener::serviceListener() {
  static Listener listener;
  return listener;
}

void Listener::blockSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGTERM);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGHUP);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
}

void Listener::setDelegate(std::shared_ptr<ListenerDelegate> delegate) {
  std::lock_guard lock(mutex_);
  delegate_ = std::move(delegate);
}

std::shared_ptr<ListenerDelegate> Listener::delegate() const {
  std::lock_guard lock(mutex_);
  return delegate_;
}

int Listener::resume() {
  std::shared_ptr<Core> core;
  {
    std::lock_guard lock(mutex_);
    core_ = std::make_shared<Core>(configuredOptions(), *this);
    core = core_;
  }
  return core->run();
}

void Listener::stop() {
  std::lock_guard lock(mutex_);
  if (core_) core_->requestStop();
}

size_t Listener::connectionCount() const {
  std::lock_guard lock(mutex_);
  return core_ ? core_->connectionCount() : 0;
}

size_t Listener::callsInFlight() const {
  std::lock_guard lock(mutex_);
  return core_ ? core_->callsInFlight() : 0;
}

}  // namespace platform
