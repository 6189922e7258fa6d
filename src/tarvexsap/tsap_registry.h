// Process-wide registry of live device contexts. Handles are tokens from a counter that never
// repeats, not addresses, so a stale handle can never reach memory that was freed or reused.
// Thread-safe. Internal to the library.
#pragma once

#include <memory>

#include "tarvexsap/tsap_device_context.h"

namespace tsap {

// registerContext keeps `context` under a new handle and returns it; null when the counter is spent.
QVSAPContextOpaque_* registerContext(std::shared_ptr<DeviceContext> context);
// Null when the handle is not live.
std::shared_ptr<DeviceContext> findContext(const QVSAPContextOpaque_* handle);
// Removes the handle; null when it was not live.
std::shared_ptr<DeviceContext> unregisterContext(const QVSAPContextOpaque_* handle);
std::size_t liveContextCount();

}  // namespace tsap
