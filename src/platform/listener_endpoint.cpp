// The listener's bus endpoint and call ledger: the exported object, the calls that come in, and
// exactly one answer to each.
#include <cstring>

#include "platform/listener_core.h"

namespace platform {

int Listener::Core::openBus() {
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

void Listener::Core::buildVTable() {
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

int Listener::Core::onMethodCall(sd_bus_message* m, void* userdata, sd_bus_error*) noexcept {
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

int Listener::Core::dispatch(sd_bus_message* m) {
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
    sendErrorNow(m, BusError{"org.freedesktop.DBus.Error.UnknownMethod", "No method " + member + " is exported here."});
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

std::string Listener::Core::memberOf(sd_bus_message* m) {
  const char* member = sd_bus_message_get_member(m);
  return member ? member : "?";
}

// Bus thread: the answer to a call, then its bookkeeping.
void Listener::Core::sendReturn(sd_bus_message* call, const Reply::Writer& writer, uint64_t id) {
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

void Listener::Core::sendError(sd_bus_message* call, const BusError& error, uint64_t id) {
  sendErrorNow(call, error);
  sd_bus_message_unref(call);
  finishCall(id);
}

void Listener::Core::sendErrorNow(sd_bus_message* call, const BusError& error) {
  sd_bus_error e{};  // no error yet
  sd_bus_error_set(&e, error.name.c_str(), error.message.c_str());
  sd_bus_reply_method_error(call, &e);
  sd_bus_error_free(&e);
}

void Listener::Core::finishCall(uint64_t id) {
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
}  // namespace platform
