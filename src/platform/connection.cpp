#include "platform/connection.h"

namespace platform {

namespace {
thread_local Connection* tCurrent = nullptr;
}

Connection::Connection(std::string peerName, EntitlementLookup entitlements)
    : peerName_(std::move(peerName)), entitlements_(std::move(entitlements)) {}

std::optional<Value> Connection::valueForEntitlement(std::string_view entitlement) const {
  if (!entitlements_) return std::nullopt;
  return entitlements_(entitlement);
}

Connection* Connection::currentConnection() { return tCurrent; }

Connection::CurrentScope::CurrentScope(Connection* connection) : previous_(tCurrent) { tCurrent = connection; }

Connection::CurrentScope::~CurrentScope() { tCurrent = previous_; }

}  // namespace platform
