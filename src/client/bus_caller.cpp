#include "client/bus_caller.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <future>

#include "client/bus_names.h"
#include "client/client_error.h"

namespace zlka_client {

struct BusCaller::Pending {
  BusCaller* owner;
  sd_bus_slot* slot = nullptr;
  ReplyHandler handler;
};

namespace {

platform::Error cancelled() {
  return clientError(ClientErrorCode::Cancelled, "The client was closed before the service answered.");
}

int openBus(const std::string& where, sd_bus** bus) {
  if (where == "system") return sd_bus_open_system(bus);
  if (where == "session") return sd_bus_open_user(bus);
  int r = sd_bus_new(bus);
  if (r < 0) return r;
  if ((r = sd_bus_set_address(*bus, where.c_str())) < 0) return r;
  if ((r = sd_bus_set_bus_client(*bus, 1)) < 0) return r;
  return sd_bus_start(*bus);
}

std::string busLabel(const std::string& where) {
  return where == "system" || where == "session" ? "the " + where + " bus" : "the bus at \"" + where + "\"";
}

platform::Error encodingFailure(int r) {
  return clientError(ClientErrorCode::InvalidRequest,
                     std::string("The call's arguments could not be encoded: ") + std::strerror(-r) + ".");
}

}  // namespace

Result<std::shared_ptr<BusCaller>> BusCaller::open(const std::string& where, std::chrono::microseconds callTimeout) {
  sd_bus* bus = nullptr;
  int r = openBus(where, &bus);
  const char* unique = nullptr;
  // The name comes with the bus's answer to Hello: a bus that does not accept us fails here.
  if (r >= 0) r = sd_bus_get_unique_name(bus, &unique);
  if (r < 0) {
    sd_bus_flush_close_unref(bus);
    // sd-bus says "No medium found" when it has no address for the session bus at all.
    std::string reason = where == "session" && r == -ENOMEDIUM ? "no session bus (DBUS_SESSION_BUS_ADDRESS and XDG_RUNTIME_DIR are unset)"
                                                              : std::strerror(-r);
    return clientError(ClientErrorCode::ConnectionFailed, "Cannot connect to " + busLabel(where) + ": " + reason + ".");
  }
  std::shared_ptr<BusCaller> caller(new BusCaller(bus, callTimeout));
  if ((r = caller->start()) < 0)
    return clientError(ClientErrorCode::ConnectionFailed, std::string("Cannot start the client's event loop: ") + std::strerror(-r) + ".");
  caller->thread_ = std::thread([self = caller] { self->run(); });
  caller->threadId_ = caller->thread_.get_id();
  return caller;
}

BusCaller::BusCaller(sd_bus* bus, std::chrono::microseconds callTimeout)
    : bus_(bus), timeoutUsec_(static_cast<uint64_t>(callTimeout.count() > 0 ? callTimeout.count() : 1)) {}

BusCaller::~BusCaller() {
  // The thread, if it ever ran, has released everything in finish(); this covers a failed start.
  if (thread_.joinable()) thread_.detach();
  sd_event_source_unref(wakeSource_);
  if (bus_) {
    sd_bus_detach_event(bus_);
    sd_bus_flush_close_unref(bus_);
  }
  sd_event_unref(event_);
  if (wakeFd_ >= 0) ::close(wakeFd_);
}

int BusCaller::start() {
  int r = sd_event_new(&event_);
  if (r < 0) return r;
  if ((wakeFd_ = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) < 0) return -errno;
  if ((r = sd_event_add_io(event_, &wakeSource_, wakeFd_, EPOLLIN, &BusCaller::onWake, this)) < 0) return r;
  return sd_bus_attach_event(bus_, event_, SD_EVENT_PRIORITY_NORMAL);
}

bool BusCaller::post(Job job) {
  {
    std::lock_guard lock(mutex_);
    if (closing_) return false;
    jobs_.push_back(std::move(job));
  }
  uint64_t one = 1;
  // The counter cannot overflow in practice; a failed write would only leave a wake-up pending.
  [[maybe_unused]] ssize_t n = ::write(wakeFd_, &one, sizeof one);
  return true;
}

void BusCaller::callAsync(std::string method, ArgumentWriter write, ReplyHandler handler) {
  auto shared = std::make_shared<ReplyHandler>(std::move(handler));
  bool queued = post([this, method = std::move(method), write = std::move(write), shared](bool isCancelled) {
    if (isCancelled) {
      platform::Error error = cancelled();
      (*shared)(nullptr, &error);
    } else {
      send(method, write, std::move(*shared));
    }
  });
  if (!queued) {
    // Closing: only a handler on the event thread can still be calling, so this is that thread.
    platform::Error error = cancelled();
    (*shared)(nullptr, &error);
  }
}

void BusCaller::failAsync(platform::Error error, ReplyHandler handler) {
  auto shared = std::make_shared<ReplyHandler>(std::move(handler));
  if (!post([shared, error](bool) { (*shared)(nullptr, &error); })) (*shared)(nullptr, &error);
}

void BusCaller::callAndWait(const std::string& method, const ArgumentWriter& write, const ReplyHandler& handler) {
  if (onEventThread()) {
    bool isClosing;
    {
      std::lock_guard lock(mutex_);
      isClosing = closing_;
    }
    if (isClosing) {
      platform::Error error = cancelled();
      return handler(nullptr, &error);
    }
    return sendAndWait(method, write, handler);
  }
  std::promise<void> done;
  std::future<void> answered = done.get_future();
  ReplyHandler signal = [&handler, &done](sd_bus_message* reply, const platform::Error* error) {
    handler(reply, error);
    done.set_value();
  };
  bool queued = post([this, &method, &write, &signal](bool isCancelled) {
    if (isCancelled) {
      platform::Error error = cancelled();
      signal(nullptr, &error);
    } else {
      send(method, write, signal);
    }
  });
  if (!queued) {
    platform::Error error = cancelled();
    return handler(nullptr, &error);
  }
  answered.wait();
}

void BusCaller::send(const std::string& method, const ArgumentWriter& write, ReplyHandler handler) {
  sd_bus_message* call = nullptr;
  int r = sd_bus_message_new_method_call(bus_, &call, kServiceName, kObjectPath, kInterfaceName, method.c_str());
  if (r < 0) {
    platform::Error error = errorFromSendFailure(r);
    return handler(nullptr, &error);
  }
  if ((r = write(call)) < 0) {
    sd_bus_message_unref(call);
    platform::Error error = encodingFailure(r);
    return handler(nullptr, &error);
  }
  auto* pending = new Pending{this, nullptr, std::move(handler)};
  r = sd_bus_call_async(bus_, &pending->slot, call, &BusCaller::onReply, pending, timeoutUsec_);
  sd_bus_message_unref(call);
  if (r < 0) {
    ReplyHandler failed = std::move(pending->handler);
    delete pending;
    platform::Error error = errorFromSendFailure(r);
    return failed(nullptr, &error);
  }
  pending_.insert(pending);
}

void BusCaller::sendAndWait(const std::string& method, const ArgumentWriter& write, const ReplyHandler& handler) {
  sd_bus_message* call = nullptr;
  int r = sd_bus_message_new_method_call(bus_, &call, kServiceName, kObjectPath, kInterfaceName, method.c_str());
  if (r < 0) {
    platform::Error error = errorFromSendFailure(r);
    return handler(nullptr, &error);
  }
  if ((r = write(call)) < 0) {
    sd_bus_message_unref(call);
    platform::Error error = encodingFailure(r);
    return handler(nullptr, &error);
  }
  sd_bus_error busError{};  // no error yet
  sd_bus_message* reply = nullptr;
  r = sd_bus_call(bus_, call, timeoutUsec_, &busError, &reply);
  sd_bus_message_unref(call);
  if (r < 0) {
    platform::Error error = sd_bus_error_is_set(&busError) ? errorFromBusError(busError.name, busError.message ? busError.message : "")
                                                           : errorFromSendFailure(r);
    sd_bus_error_free(&busError);
    return handler(nullptr, &error);
  }
  handler(reply, nullptr);
  sd_bus_message_unref(reply);
}

int BusCaller::onReply(sd_bus_message* reply, void* userdata, sd_bus_error*) noexcept {
  auto* pending = static_cast<Pending*>(userdata);
  pending->owner->pending_.erase(pending);
  ReplyHandler handler = std::move(pending->handler);
  sd_bus_slot_unref(pending->slot);  // sd-bus holds its own reference while this runs
  delete pending;
  if (sd_bus_message_is_method_error(reply, nullptr)) {
    const sd_bus_error* e = sd_bus_message_get_error(reply);
    platform::Error error = errorFromBusError(e && e->name ? e->name : "", e && e->message ? e->message : "");
    handler(nullptr, &error);
  } else {
    handler(reply, nullptr);
  }
  return 0;
}

int BusCaller::onWake(sd_event_source*, int fd, uint32_t, void* userdata) noexcept {
  auto* self = static_cast<BusCaller*>(userdata);
  uint64_t count = 0;
  [[maybe_unused]] ssize_t n = ::read(fd, &count, sizeof count);
  std::deque<Job> jobs;
  bool stop;
  {
    std::lock_guard lock(self->mutex_);
    jobs.swap(self->jobs_);
    stop = self->closing_;
  }
  for (Job& job : jobs) job(stop);
  if (stop) sd_event_exit(self->event_, 0);
  return 0;
}

void BusCaller::run() {
  sd_event_loop(event_);
  finish();
}

void BusCaller::finish() {
  // Whatever is still queued or unanswered gets Cancelled; handlers may call again, and are then
  // answered at once, so this ends.
  for (;;) {
    std::deque<Job> jobs;
    {
      std::lock_guard lock(mutex_);
      closing_ = true;
      jobs.swap(jobs_);
    }
    std::unordered_set<Pending*> pending;
    pending.swap(pending_);
    if (jobs.empty() && pending.empty()) break;
    for (Job& job : jobs) job(true);
    for (Pending* p : pending) {
      ReplyHandler handler = std::move(p->handler);
      sd_bus_slot_unref(p->slot);
      delete p;
      platform::Error error = cancelled();
      handler(nullptr, &error);
    }
  }
  wakeSource_ = sd_event_source_unref(wakeSource_);
  sd_bus_detach_event(bus_);
  bus_ = sd_bus_flush_close_unref(bus_);
  event_ = sd_event_unref(event_);
  ::close(wakeFd_);
  wakeFd_ = -1;
}

void BusCaller::close() {
  {
    std::lock_guard lock(mutex_);
    if (closing_) return;
    closing_ = true;
  }
  uint64_t one = 1;
  [[maybe_unused]] ssize_t n = ::write(wakeFd_, &one, sizeof one);
  if (!thread_.joinable()) return;
  if (onEventThread()) thread_.detach();
  else thread_.join();
}

}  // namespace zlka_client
