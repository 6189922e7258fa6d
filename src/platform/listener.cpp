// The listener's public face and its run loop: events, posted work, signals, the drain and the idle exit.
#include "platform/listener.h"

#include <signal.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include "platform/listener_core.h"

namespace platform {

namespace {

ListenerOptions& configuredOptions() {
  static ListenerOptions options;
  return options;
}

}  // namespace

int Listener::Core::run() {
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

// Runs `work` on the bus thread. Fails only for want of memory, and then drops the work.
void Listener::Core::post(std::function<void()> work) noexcept {
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

void Listener::Core::requestStop() {
  post([self = shared_from_this()] { self->beginDrain("stop requested"); });
}

int Listener::Core::onPosted(sd_event_source*, int fd, uint32_t, void* userdata) {
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

int Listener::Core::onSignal(sd_event_source*, const struct signalfd_siginfo* info, void* userdata) {
  auto* self = static_cast<Core*>(userdata);
  if (info->ssi_signo == SIGHUP) {
    log(LogLevel::Default, "Reloading on SIGHUP");
    if (self->options_.onReload) self->options_.onReload();
    return 0;
  }
  self->beginDrain(info->ssi_signo == SIGTERM ? "SIGTERM" : "SIGINT");
  return 0;
}

void Listener::Core::beginDrain(const std::string& why) {
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

int Listener::Core::onDrainLimit(sd_event_source*, uint64_t, void* userdata) {
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

void Listener::Core::armIdleTimer(uint64_t at) {
  if (!idleTimer_) {
    if (addSource(sd_event_add_time, CLOCK_MONOTONIC, at, uint64_t{0}, &Guarded<&Core::onIdleTimer>::call) >= 0)
      idleTimer_ = sources_.back().get();
    return;
  }
  sd_event_source_set_time(idleTimer_, at);
  sd_event_source_set_enabled(idleTimer_, SD_EVENT_ONESHOT);
}

int Listener::Core::onIdleTimer(sd_event_source*, uint64_t, void* userdata) {
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

uint64_t Listener::Core::now() const {
  uint64_t t = 0;
  sd_event_now(event_.get(), CLOCK_MONOTONIC, &t);
  return t;
}

int Listener::Core::fail(const std::string& what, int rc) {
  log(LogLevel::Fault, "Messaging: %s: %s", what, std::string(strerror(-rc)));
  return 1;
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
