#include "support/system_info.h"

#include <chrono>
#include <cmath>
#include <mutex>

#include "platform/device_facts.h"
#include "platform/process_memory.h"

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

bool getMemoryUse(uint64_t* residentSize, uint64_t* virtualSize, uint64_t* footprint) {
  std::optional<platform::ProcessMemory> m = platform::readProcessMemory();
  if (!m) return false;
  if (residentSize) *residentSize = m->resident;
  if (virtualSize) *virtualSize = m->virtualSize;
  if (footprint) *footprint = m->footprint;
  return true;
}
