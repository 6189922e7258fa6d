#include "platform/listener/call_ledger.h"

#include <cstring>

#include "platform/log/log.h"

namespace platform {

uint64_t CallLedger::take(sd_bus_message* call, const std::string& peer) {
  uint64_t id = lastId_ + 1;
  calls_.emplace(id, Entry{BusMessagePtr(sd_bus_message_ref(call)), peer});
  lastId_ = id;
  open_.store(calls_.size());
  return id;
}

std::optional<std::string> CallLedger::answer(uint64_t id, const Reply::Writer& writer) {
  auto entry = calls_.find(id);
  if (entry == calls_.end()) return std::nullopt;
  sd_bus_message* call = entry->second.call.get();
  sd_bus_message* made = nullptr;
  int rc = sd_bus_message_new_method_return(call, &made);
  BusMessagePtr reply(made);
  if (rc >= 0 && writer) rc = writer(reply.get());
  if (rc >= 0) rc = sd_bus_send(sd_bus_message_get_bus(call), reply.get(), nullptr);
  if (rc < 0) {
    log(LogLevel::Error, "Could not encode the answer to %s: %s", memberOf(call), std::string(strerror(-rc)));
    sendError(call, BusError{kBusErrorFailed, "The answer could not be encoded."});
  }
  return forget(entry);
}

std::optional<std::string> CallLedger::fail(uint64_t id, const BusError& error) {
  auto entry = calls_.find(id);
  if (entry == calls_.end()) return std::nullopt;
  sendError(entry->second.call.get(), error);
  return forget(entry);
}

size_t CallLedger::failAll(const BusError& error) {
  size_t count = calls_.size();
  for (auto& [id, entry] : calls_) sendError(entry.call.get(), error);
  calls_.clear();
  open_.store(0);
  return count;
}

std::optional<std::string> CallLedger::forget(std::map<uint64_t, Entry>::iterator entry) {
  std::string peer = std::move(entry->second.peer);
  calls_.erase(entry);
  open_.store(calls_.size());
  return peer;
}

void CallLedger::sendError(sd_bus_message* call, const BusError& error) {
  BusErrorGuard e;
  sd_bus_error_set(&e.error, error.name.c_str(), error.message.c_str());
  sd_bus_reply_method_error(call, &e.error);
}

std::string CallLedger::memberOf(sd_bus_message* m) {
  const char* member = sd_bus_message_get_member(m);
  return member ? member : "?";
}

}  // namespace platform
