// Guarded<&handler>::call: a C callback for sd-bus and sd-event that runs `handler` and lets no
// exception through. Those libraries call back through C, where no exception may pass: a handler
// that fails (as when it runs out of a resource) is logged, answers the zero value of its return
// type, and the loop serves on.
#pragma once

#include <exception>

#include "platform/log/log.h"

namespace platform {

template <auto Handler>
struct Guarded;
template <class R, class... A, R (*Handler)(A...)>
struct Guarded<Handler> {
  static R call(A... arguments) noexcept {
    try {
      return Handler(arguments...);
    } catch (const std::exception& e) {
      log(LogLevel::Error, "Messaging: a handler failed: %s", e.what());
    } catch (...) {
      log(LogLevel::Error, "Messaging: a handler failed");
    }
    return R{};
  }
};

}  // namespace platform
