// Owning handles for the C objects of sd-bus, sd-event and the kernel: a reader never sees a
// hand-written unref or close. Each is a move-only unique_ptr (or UniqueFd) that releases its
// object when it goes out of scope; `.get()` borrows, `.release()` hands ownership back to C.
#pragma once

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>
#include <unistd.h>

#include <memory>
#include <utility>

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

// A file descriptor that is closed when it goes out of scope; -1 holds nothing.
class UniqueFd {
 public:
  UniqueFd() = default;
  // UniqueFd takes ownership of `fd` (-1 for none).
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    if (this != &other) reset(std::exchange(other.fd_, -1));
    return *this;
  }
  ~UniqueFd() { reset(); }

  // get borrows the descriptor (-1 when none); the conversion is true when one is held.
  int get() const { return fd_; }
  explicit operator bool() const { return fd_ >= 0; }
  // Closes the descriptor held, if any, and holds `fd` instead.
  void reset(int fd = -1) {
    if (fd_ >= 0) ::close(fd_);
    fd_ = fd;
  }
  // release hands the descriptor (or -1) to the caller, who must close it; none is held after.
  int release() { return std::exchange(fd_, -1); }

 private:
  int fd_ = -1;
};

}  // namespace platform
