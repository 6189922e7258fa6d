// The listener's bus endpoint: the exported object, the calls that come in, and the way each one's
// answer travels back to the bus thread and into the ledger.
#include <cstring>

#include "platform/listener/listener_core.h"

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
    log(LogLevel::Error, "Cannot serve a call to %s: %s", CallLedger::memberOf(m), e.what());
    CallLedger::sendError(m, BusError{kBusErrorFailed, "The service is short of resources; try again."});
  }
  return 1;
}

int Listener::Core::dispatch(sd_bus_message* m) {
  const char* senderRaw = sd_bus_message_get_sender(m);
  std::string member = CallLedger::memberOf(m);
  if (draining_) {
    CallLedger::sendError(m, BusError{kBusErrorNoServer, "The service is shutting down."});
    return 1;
  }
  if (!senderRaw) {
    CallLedger::sendError(m, BusError{kBusErrorAccessDenied, "Calls must come through the bus."});
    return 1;
  }
  std::string sender = senderRaw;
  std::shared_ptr<Connection> connection = peers_.connectionFor(sender);
  if (!connection || !connection->isResumed()) {
    CallLedger::sendError(m, BusError{kBusErrorAccessDenied, "The connection was not accepted."});
    return 1;
  }
  std::shared_ptr<const Interface> interface = connection->exportedInterface();
  const InterfaceMethod* method = nullptr;
  if (interface)
    for (const auto& candidate : interface->methods)
      if (candidate.name == member) method = &candidate;
  if (!method) {
    CallLedger::sendError(
        m, BusError{"org.freedesktop.DBus.Error.UnknownMethod", "No method " + member + " is exported here."});
    return 1;
  }
  DecodedCall decoded;
  try {
    decoded = method->decode(m, connection->exportedObject());
  } catch (const std::exception& e) {
    decoded.error = BusError{kBusErrorFailed, std::string("The call could not be decoded: ") + e.what()};
  }
  if (decoded.error || !decoded.invocation) {
    CallLedger::sendError(m, decoded.error.value_or(BusError{kBusErrorFailed, "The call could not be decoded."}));
    return 1;
  }
  auto state = std::make_shared<Reply::State>();
  state->core = weak_from_this();
  // From here on the call is answered exactly once through the ledger: dropped unanswered (as
  // when it cannot be queued for want of memory), its state answers with an error itself.
  state->id = ledger_.take(m, sender);
  lastActivity_ = now();
  Reply reply(state);
  try {
    peers_.enqueue(sender, std::move(decoded.invocation), std::move(reply));
  } catch (const std::exception& e) {
    log(LogLevel::Error, "Cannot queue a call to %s: %s", member, e.what());
  }
  return 1;
}

void Listener::Core::sendReturn(uint64_t id, const Reply::Writer& writer) {
  if (auto peer = ledger_.answer(id, writer)) finishCall(*peer);
}

void Listener::Core::sendError(uint64_t id, const BusError& error) {
  if (auto peer = ledger_.fail(id, error)) finishCall(*peer);
}

void Listener::Core::finishCall(const std::string& peer) {
  peers_.finished(peer);
  lastActivity_ = now();
  if (draining_ && ledger_.open() == 0) sd_event_exit(event_.get(), 0);
}

Reply::State::~State() {
  if (done.exchange(true) || id == 0) return;
  // Dropped without an answer: the caller still gets one. Should even that not reach the bus
  // thread, the call stays in the ledger, which answers it when the service shuts down.
  if (auto c = core.lock())
    c->post([c, id = id] { c->sendError(id, BusError{kBusErrorFailed, "The operation ended without an answer."}); });
}

// A reply that cannot be handed to the bus thread is not lost: it is taken back, and the state
// answers with an error when its last copy goes.
void Reply::send(Writer writer) const {
  if (state_->done.exchange(true)) return;
  auto core = state_->core.lock();
  if (core && !core->post([core, writer = std::move(writer), id = state_->id] { core->sendReturn(id, writer); }))
    state_->done = false;
}

void Reply::fail(BusError error) const {
  if (state_->done.exchange(true)) return;
  auto core = state_->core.lock();
  if (core && !core->post([core, error = std::move(error), id = state_->id] { core->sendError(id, error); }))
    state_->done = false;
}

}  // namespace platform
