#include "support/obfuscated_pointer.h"

#include <sys/random.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>

namespace {

// Two racing first calls may each draw; one offset wins, which only affects log lines.
std::atomic<uintptr_t> gOffset{0};

// random() is never seeded in this process, so its first value is the same everywhere and would
// give every address away by one subtraction: the draw comes from a generator of our own, seeded
// from the kernel's random source.
uintptr_t drawOffset() {
  unsigned int seed = 0;
  ssize_t got;
  do got = getrandom(&seed, sizeof seed, 0);
  while (got < 0 && errno == EINTR);
  if (got != static_cast<ssize_t>(sizeof seed)) return 0;
  char state[64] = {};
  random_data generator{};
  int32_t value = 0;
  if (initstate_r(seed, state, sizeof state, &generator) != 0 || random_r(&generator, &value) != 0) return 0;
  return static_cast<uintptr_t>(value);
}

}  // namespace

uintptr_t obfuscatedPointer(const void* pointer) {
  if (!pointer) return 0;
  uintptr_t offset = gOffset.load(std::memory_order_relaxed);
  if (offset == 0) {
    offset = drawOffset();
    gOffset.store(offset, std::memory_order_relaxed);
  }
  return reinterpret_cast<uintptr_t>(pointer) + offset;
}
