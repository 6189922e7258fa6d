#include "platform/process_memory.h"

#include <cstdio>
#include <cstring>

namespace platform {

std::optional<ProcessMemory> readProcessMemory() {
  std::FILE* f = std::fopen("/proc/self/status", "re");
  if (!f) return std::nullopt;
  ProcessMemory m;
  unsigned seen = 0;
  char line[256];
  while (std::fgets(line, sizeof line, f)) {
    unsigned long long kb = 0;
    if (std::sscanf(line, "VmRSS: %llu kB", &kb) == 1) {
      m.resident = kb * 1024;
      seen |= 1;
    } else if (std::sscanf(line, "VmSize: %llu kB", &kb) == 1) {
      m.virtualSize = kb * 1024;
      seen |= 2;
    } else if (std::sscanf(line, "RssAnon: %llu kB", &kb) == 1 || std::sscanf(line, "VmSwap: %llu kB", &kb) == 1) {
      m.footprint += kb * 1024;
      seen |= 4;
    }
  }
  std::fclose(f);
  if ((seen & 3) != 3) return std::nullopt;
  return m;
}

}  // namespace platform
