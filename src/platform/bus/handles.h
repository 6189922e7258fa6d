// Owning handles for the C objects of sd-bus, sd-event and the kernel: a reader never sees a
// hand-written unref or close. Each is a move-only unique_ptr (or UniqueFd) that releases its
// object when it goes out of scope; `.get()` borrows, `.release()` hands ownership back to C.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <memory>
#include <utility>

#include "platform/values/unique_fd.h"

namespace platform {

template <typename T, auto Release>
struct HandleReleaser {
  // Releases `p` with the library's own function for it.
  void operator()(T* p) const { Release(p); }
};

using BusPtr = std::unique_ptr<sd_bus, HandleReleaser<sd_bus, sd_bus_flush_close_unref>>;
using BusMessagePtr = std::unique_ptr<sd_bus_message, HandleReleaser<sd_bus_message, sd_bus_message_unref>>;
using BusSlotPtr = std::unique_ptr<sd_bus_slot, HandleReleaser<sd_bus_slot, sd_bus_slot_unref>>;
using EventPtr = std::unique_ptr<sd_event, HandleReleaser<sd_event, sd_event_unref>>;
// Disabled before it is released, so that a source dropped while the loop runs never fires again.
using EventSourcePtr = std::unique_ptr<sd_event_source, HandleReleaser<sd_event_source, sd_event_source_disable_unref>>;

// An sd_bus_error that frees its strings when it goes out of scope.
struct BusErrorGuard {
  sd_bus_error error{};  // SD_BUS_ERROR_NULL is a compound literal, which pedantic C++ refuses
  BusErrorGuard() = default;
  BusErrorGuard(const BusErrorGuard&) = delete;
  BusErrorGuard& operator=(const BusErrorGuard&) = delete;
  ~BusErrorGuard() { sd_bus_error_free(&error); }
};
}  // namespace platform
