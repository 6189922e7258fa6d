#include "support/system_info.h"

#include <chrono>
#include <cmath>
#include <cstdio>
#include <memory>
#include <mutex>

#include "platform/config/device_facts.h"

bool systemInfo_isInternalBuild() {
  static std::once_flag once;
  static bool internal = false;
  std::call_once(once, [] { internal = platform::deviceAnswerBool("InternalBuild").value_or(false); });
  return internal;
}

std::optional<std::string> systemInfo_copyDeviceClass() { return platform::deviceAnswerString("DeviceClass"); }

namespace systemInfo_detail {
uint64_t roundedUnixTime(double seconds, double scale) {
  if (!(seconds > 0)) return 0;
  return static_cast<uint64_t>(std::round(seconds * scale));
}
}  // namespace systemInfo_detail

namespace {
double clockSeconds() {
  using namespace std::chrono;
  return duration<double>(system_clock::now().time_since_epoch()).count();
}
}  // namespace

uint64_t systemInfo_getCurrentUnixTime() { return systemInfo_detail::roundedUnixTime(clockSeconds(), 1.0); }
uint64_t systemInfo_getCurrentUnixTimeMS() { return systemInfo_detail::roundedUnixTime(clockSeconds(), 1000.0); }

// Reads /proc/self/status; the footprint is anonymous resident memory plus swapped-out memory.
bool getMemoryUse(uint64_t* residentSize, uint64_t* virtualSize, uint64_t* footprint) {
  std::unique_ptr<std::FILE, int (*)(std::FILE*)> file(std::fopen("/proc/self/status", "re"), &std::fclose);
  if (!file) return false;
  uint64_t resident = 0, size = 0, anonymous = 0;
  unsigned seen = 0;
  char line[256];
  while (std::fgets(line, sizeof line, file.get())) {
    unsigned long long kb = 0;
    if (std::sscanf(line, "VmRSS: %llu kB", &kb) == 1) {
      resident = kb * 1024;
      seen |= 1;
    } else if (std::sscanf(line, "VmSize: %llu kB", &kb) == 1) {
      size = kb * 1024;
      seen |= 2;
    } else if (std::sscanf(line, "RssAnon: %llu kB", &kb) == 1 || std::sscanf(line, "VmSwap: %llu kB", &kb) == 1) {
      anonymous += kb * 1024;
    }
  }
  if ((seen & 3) != 3) return false;
  if (residentSize) *residentSize = resident;
  if (virtualSize) *virtualSize = size;
  if (footprint) *footprint = anonymous;
  return true;
}
