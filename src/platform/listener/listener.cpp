// The listener's public face and its run loop: events, posted work, signals, the drain and the idle exit.
#include "platform/listener/listener.h"

#include <signal.h>
#include <sys/signalfd.h>
#include <systemd/sd-daemon.h>

#include <cstring>

#include "platform/listener/listener_core.h"

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
  if ((rc = mailbox_.attach(event_.get())) < 0) return fail("cannot watch the mailbox of the event loop", rc);
  for (int sig : {SIGTERM, SIGINT, SIGHUP})
    if ((rc = addSource(sd_event_add_signal, sig, &Guarded<&Core::onSignal>::call)) < 0)
      return fail("cannot handle signals (call Listener::blockSignals() first)", rc);
  buildVTable();
  sd_bus_slot* slot = nullptr;
  rc = sd_bus_add_object_vtable(bus_.get(), &slot, options_.objectPath.c_str(), options_.interface->name.c_str(),
                                vtable_.data(), this);
  vtableSlot_.reset(slot);
  if (rc < 0) return fail("cannot export " + options_.objectPath, rc);
  if ((rc = peers_.watch(bus_.get())) < 0) return fail("cannot watch peers leaving the bus", rc);
  if (options_.onServing) serving_ = options_.onServing(bus_.get(), event_.get());
  rc = sd_bus_request_name(bus_.get(), options_.serviceName.c_str(), 0);
  if (rc < 0) return fail("cannot own the name " + options_.serviceName, rc);
  lastActivity_ = now();
  if (options_.exitOnIdle) armIdleTimer(lastActivity_ + toUsec(*options_.exitOnIdle));
  log(LogLevel::Default, "Listening as %s on %s at %s", options_.serviceName, options_.bus, options_.objectPath);
  if (options_.notifyReady) sd_notify(0, "READY=1\nSTATUS=Serving requests");
  rc = sd_event_loop(event_.get());
  serving_.reset();
  if (options_.notifyReady) sd_notify(0, "STOPPING=1");
  // Answers handed over as the loop ended still go out, and a call left open (the loop failed) is
  // answered rather than left waiting.
  mailbox_.drain();
  if (size_t left =
          ledger_.failAll(BusError{kBusErrorNoServer, "The service shut down before the operation finished."}))
    log(LogLevel::Error, "Messaging: the event loop ended with %zu call(s) unanswered", left);
  return rc < 0 ? 1 : rc;
}

void Listener::Core::requestStop() {
  post([self = shared_from_this()] { self->beginDrain("stop requested"); });
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
  log(LogLevel::Default, "Shutting down (%s) with %zu call(s) in flight", why, ledger_.open());
  if (options_.notifyReady) sd_notify(0, "STOPPING=1");
  sd_bus_release_name(bus_.get(), options_.serviceName.c_str());
  if (ledger_.open() == 0) {
    sd_event_exit(event_.get(), 0);
    return;
  }
  addSource(sd_event_add_time_relative, CLOCK_MONOTONIC, toUsec(options_.drainLimit), uint64_t{0},
            &Guarded<&Core::onDrainLimit>::call);
}

int Listener::Core::onDrainLimit(sd_event_source*, uint64_t, void* userdata) {
  auto* self = static_cast<Core*>(userdata);
  log(LogLevel::Error, "Calls still in flight after the drain limit: failing %zu of them", self->ledger_.open());
  self->ledger_.failAll(BusError{kBusErrorNoServer, "The service shut down before the operation finished."});
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
  if (self->ledger_.open() == 0 && t - self->lastActivity_ >= limit) {
    self->beginDrain("idle");
    return 0;
  }
  // Idle since the last call ended: due N after it. Calls in flight end at a time nobody knows yet,
  // so look again in a second; either way the exit comes within a second of N after the last call.
  self->armIdleTimer(self->ledger_.open() == 0 ? self->lastActivity_ + limit : t + toUsec(std::chrono::seconds(1)));
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
