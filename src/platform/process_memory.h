// Memory use of the calling process, from /proc/self/status: resident size, virtual size and the
// physical footprint (anonymous resident memory plus swapped-out memory), all in bytes.
#pragma once

#include <cstdint>
#include <optional>

namespace platform {

struct ProcessMemory {
  uint64_t resident = 0;
  uint64_t virtualSize = 0;
  uint64_t footprint = 0;
};

std::optional<ProcessMemory> readProcessMemory();

}  // namespace platform
