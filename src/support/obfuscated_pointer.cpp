#include "support/obfuscated_pointer.h"

#include <atomic>
#include <cstdlib>

namespace {
// Two racing first calls may each draw; one offset wins, which only affects log lines.
std::atomic<uintptr_t> gOffset{0};
}  // namespace

uintptr_t obfuscatedPointer(const void* pointer) {
  if (!pointer) return 0;
  uintptr_t offset = gOffset.load(std::memory_order_relaxed);
  if (offset == 0) {
    offset = static_cast<uintptr_t>(random());
    gOffset.store(offset, std::memory_order_relaxed);
  }
  return reinterpret_cast<uintptr_t>(pointer) + offset;
}
