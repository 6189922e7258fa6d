#include "tarvexsap/tsap_registry.h"

#include <cstdint>
#include <mutex>
#include <unordered_map>

namespace tsap {
namespace {

std::mutex registryMutex;
std::unordered_map<uintptr_t, std::shared_ptr<DeviceContext>> live;  // guarded by registryMutex
uintptr_t lastToken = 0;                                             // guarded by registryMutex

uintptr_t tokenOf(const QVSAPContextOpaque_* handle) { return reinterpret_cast<uintptr_t>(handle); }

}  // namespace

QVSAPContextOpaque_* registerContext(std::shared_ptr<DeviceContext> context) {
  std::lock_guard lock(registryMutex);
  if (lastToken == UINTPTR_MAX) {
    return nullptr;  // the token space is spent; never hand out a repeat
  }
  const uintptr_t token = ++lastToken;
  live.emplace(token, std::move(context));
  return reinterpret_cast<QVSAPContextOpaque_*>(token);
}

std::shared_ptr<DeviceContext> findContext(const QVSAPContextOpaque_* handle) {
  std::lock_guard lock(registryMutex);
  const auto it = live.find(tokenOf(handle));
  return it == live.end() ? nullptr : it->second;
}

std::shared_ptr<DeviceContext> unregisterContext(const QVSAPContextOpaque_* handle) {
  std::lock_guard lock(registryMutex);
  const auto it = live.find(tokenOf(handle));
  if (it == live.end()) {
    return nullptr;
  }
  auto context = std::move(it->second);
  live.erase(it);
  return context;
}

std::size_t liveContextCount() {
  std::lock_guard lock(registryMutex);
  return live.size();
}

}  // namespace tsap
