#include "platform/listener/connection.h"

#include "platform/dispatch/worker_pool.h"

namespace platform {

namespace {
thread_local Connection* tCurrent = nullptr;
}

Connection::Connection(std::string peerName, EntitlementLookup entitlements)
    : peerName_(std::move(peerName)), entitlements_(std::move(entitlements)) {}

std::optional<Value> Connection::valueForEntitlement(std::string_view entitlement) const {
  EntitlementLookup lookup;
  {
    std::lock_guard lock(mutex_);
    lookup = entitlements_;
  }
  if (!lookup) return std::nullopt;
  return lookup(entitlement);
}

void Connection::setEntitlementLookup(EntitlementLookup lookup) {
  std::lock_guard lock(mutex_);
  entitlements_ = std::move(lookup);
}

Connection* Connection::currentConnection() { return tCurrent; }

void Connection::setExportedInterface(std::shared_ptr<const Interface> interface) {
  std::lock_guard lock(mutex_);
  interface_ = std::move(interface);
}

void Connection::setExportedObject(std::shared_ptr<void> object) {
  std::lock_guard lock(mutex_);
  object_ = std::move(object);
}

void Connection::resume() {
  std::lock_guard lock(mutex_);
  resumed_ = true;
}

std::shared_ptr<const Interface> Connection::exportedInterface() const {
  std::lock_guard lock(mutex_);
  return interface_;
}

std::shared_ptr<void> Connection::exportedObject() const {
  std::lock_guard lock(mutex_);
  return object_;
}

bool Connection::isResumed() const {
  std::lock_guard lock(mutex_);
  return resumed_;
}

std::shared_ptr<Queue> Connection::queue() {
  std::lock_guard lock(mutex_);
  if (!queue_) queue_ = Queue::serial("Connection." + peerName_, &WorkerPool::connections());
  return queue_;
}

Connection::CurrentScope::CurrentScope(Connection* connection) : previous_(tCurrent) { tCurrent = connection; }

Connection::CurrentScope::~CurrentScope() { tCurrent = previous_; }

}  // namespace platform
