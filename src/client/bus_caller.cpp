#include "client/bus_caller.h"

#include <cerrno>
#include <cstring>
#include <future>

#include "client/bus_names.h"
#include "client/client_error.h"

namespace zlka_client {

namespace {

platform::Error cancelled() {
  return clientError(ClientErrorCode::Cancelled, "The client was closed before the service answered.");
}

int openBus(const std::string& where, platform::BusPtr& bus) {
  sd_bus* made = nullptr;
  int r = where == "system"    ? sd_bus_open_system(&made)
          : where == "session" ? sd_bus_open_user(&made)
                               : sd_bus_new(&made);
  bus.reset(made);
  if (r < 0 || where == "system" || where == "session") return r;
  if ((r = sd_bus_set_address(made, where.c_str())) < 0) return r;
  if ((r = sd_bus_set_bus_client(made, 1)) < 0) return r;
  return sd_bus_start(made);
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
  platform::BusPtr bus;
  int r = openBus(where, bus);
  const char* unique = nullptr;
  // The name comes with the bus's answer to Hello: a bus that does not accept us fails here.
  if (r >= 0) r = sd_bus_get_unique_name(bus.get(), &unique);
  if (r < 0) {
    // sd-bus says "No medium found" when it has no address for the session bus at all.
    std::string reason = where == "session" && r == -ENOMEDIUM
                             ? "no session bus (DBUS_SESSION_BUS_ADDRESS and XDG_RUNTIME_DIR are unset)"
                             : std::strerror(-r);
    return clientError(ClientErrorCode::ConnectionFailed, "Cannot connect to " + busLabel(where) + ": " + reason + ".");
  }
  std::shared_ptr<BusCaller> caller(new BusCaller(std::move(bus), callTimeout));
  if ((r = caller->start()) < 0)
    return clientError(ClientErrorCode::ConnectionFailed,
                       std::string("Cannot start the client's event loop: ") + std::strerror(-r) + ".");
  caller->thread_ = std::thread([self = caller] { self->run(); });
  caller->threadId_ = caller->thread_.get_id();
  return caller;
}

BusCaller::BusCaller(platform::BusPtr bus, std::chrono::microseconds callTimeout)
    : bus_(std::move(bus)), timeoutUsec_(static_cast<uint64_t>(callTimeout.count() > 0 ? callTimeout.count() : 1)) {}

BusCaller::~BusCaller() {
  // The thread, if it ever ran, has released the bus in finish(); this covers a failed start.
  if (thread_.joinable()) thread_.detach();
}

int BusCaller::start() {
  sd_event* event = nullptr;
  int r = sd_event_new(&event);
  event_.reset(event);
  if (r < 0) return r;
  if ((r = mailbox_.attach(event)) < 0) return r;
  return sd_bus_attach_event(bus_.get(), event, SD_EVENT_PRIORITY_NORMAL);
}

bool BusCaller::post(std::function<void(bool closing)> job) {
  return mailbox_.post([this, job = std::move(job)] { job(mailbox_.isClosed()); });
}

// Refused while closing, only a handler on the event thread can still be calling; otherwise memory
// ran out. Either way the caller's handler runs at once with this.
platform::Error BusCaller::postFailure() const {
  return mailbox_.isClosed() ? cancelled() : errorFromSendFailure(-ENOMEM);
}

void BusCaller::callAsync(std::string method, ArgumentWriter write, ReplyHandler handler) {
  auto shared = std::make_shared<ReplyHandler>(std::move(handler));
  bool queued = post([this, method = std::move(method), write = std::move(write), shared](bool closing) {
    if (closing) {
      platform::Error error = cancelled();
      (*shared)(nullptr, &error);
    } else {
      send(method, write, std::move(*shared));
    }
  });
  if (!queued) {
    platform::Error error = postFailure();
    (*shared)(nullptr, &error);
  }
}

void BusCaller::failAsync(platform::Error error, ReplyHandler handler) {
  auto shared = std::make_shared<ReplyHandler>(std::move(handler));
  if (!post([shared, error](bool) { (*shared)(nullptr, &error); })) (*shared)(nullptr, &error);
}

void BusCaller::callAndWait(const std::string& method, const ArgumentWriter& write, const ReplyHandler& handler) {
  if (onEventThread()) {
    if (mailbox_.isClosed()) {
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
  bool queued = post([this, &method, &write, &signal](bool closing) {
    if (closing) {
      platform::Error error = cancelled();
      signal(nullptr, &error);
    } else {
      send(method, write, signal);
    }
  });
  if (!queued) {
    platform::Error error = postFailure();
    return handler(nullptr, &error);
  }
  answered.wait();
}

Result<platform::BusMessagePtr> BusCaller::newCall(const std::string& method, const ArgumentWriter& write) {
  sd_bus_message* made = nullptr;
  int r = sd_bus_message_new_method_call(bus_.get(), &made, kServiceName, kObjectPath, kInterfaceName, method.c_str());
  platform::BusMessagePtr call(made);
  if (r < 0) return errorFromSendFailure(r);
  if ((r = write(call.get())) < 0) return encodingFailure(r);
  return call;
}

void BusCaller::send(const std::string& method, const ArgumentWriter& write, ReplyHandler handler) {
  Result<platform::BusMessagePtr> call = newCall(method, write);
  if (!call) return handler(nullptr, &call.error());
  uint64_t id = ++lastId_;
  Pending& pending = pending_.emplace(id, Pending{this, id, nullptr, std::move(handler)}).first->second;
  sd_bus_slot* slot = nullptr;
  int r = sd_bus_call_async(bus_.get(), &slot, call.value().get(), &BusCaller::onReply, &pending, timeoutUsec_);
  pending.slot.reset(slot);
  if (r < 0) {
    ReplyHandler failed = std::move(pending.handler);
    pending_.erase(id);
    platform::Error error = errorFromSendFailure(r);
    failed(nullptr, &error);
  }
}

void BusCaller::sendAndWait(const std::string& method, const ArgumentWriter& write, const ReplyHandler& handler) {
  Result<platform::BusMessagePtr> call = newCall(method, write);
  if (!call) return handler(nullptr, &call.error());
  platform::BusErrorGuard busError;
  sd_bus_message* answer = nullptr;
  int r = sd_bus_call(bus_.get(), call.value().get(), timeoutUsec_, &busError.error, &answer);
  platform::BusMessagePtr reply(answer);
  if (r < 0) {
    const sd_bus_error& e = busError.error;
    platform::Error error =
        sd_bus_error_is_set(&e) ? errorFromBusError(e.name, e.message ? e.message : "") : errorFromSendFailure(r);
    return handler(nullptr, &error);
  }
  handler(reply.get(), nullptr);
}

int BusCaller::onReply(sd_bus_message* reply, void* userdata, sd_bus_error*) noexcept {
  auto* pending = static_cast<Pending*>(userdata);
  ReplyHandler handler = std::move(pending->handler);
  uint64_t id = pending->id;
  pending->owner->pending_.erase(id);  // releases the slot; sd-bus holds its own reference while this runs
  if (sd_bus_message_is_method_error(reply, nullptr)) {
    const sd_bus_error* e = sd_bus_message_get_error(reply);
    platform::Error error = errorFromBusError(e && e->name ? e->name : "", e && e->message ? e->message : "");
    handler(nullptr, &error);
  } else {
    handler(reply, nullptr);
  }
  return 0;
}

void BusCaller::run() {
  sd_event_loop(event_.get());
  finish();
}

void BusCaller::finish() {
  // Whatever is still queued or unanswered gets Cancelled. Handlers may call again: the mailbox is
  // closed by then, so those calls are cancelled at once and nothing new waits for an answer.
  mailbox_.drain();
  std::unordered_map<uint64_t, Pending> pending;
  pending.swap(pending_);
  for (auto& [id, p] : pending) {
    ReplyHandler handler = std::move(p.handler);
    p.slot.reset();
    platform::Error error = cancelled();
    handler(nullptr, &error);
  }
  sd_bus_detach_event(bus_.get());
  bus_.reset();
}

void BusCaller::close() {
  if (!mailbox_.close() || !thread_.joinable()) return;
  if (onEventThread())
    thread_.detach();
  else
    thread_.join();
}

}  // namespace zlka_client
