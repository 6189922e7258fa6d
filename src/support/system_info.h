// Facts about the device, the build, the clock and the process's memory.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

// The device's "InternalBuild" answer, asked once per process and cached.
bool systemInfo_isInternalBuild();
// The device's "DeviceClass" answer, asked at every call; nullopt when the device has none.
std::optional<std::string> systemInfo_copyDeviceClass();

// Seconds (or milliseconds) since 1970-01-01 UTC, rounded to nearest, halves away from zero;
// 0 when the clock reads 0 or earlier.
uint64_t systemInfo_getCurrentUnixTime();
uint64_t systemInfo_getCurrentUnixTimeMS();

// Resident size, virtual size and physical footprint of this process in bytes. Writes the pointers
// given and returns true; on failure writes nothing and returns false.
bool getMemoryUse(uint64_t* residentSize, uint64_t* virtualSize, uint64_t* footprint);

namespace systemInfo_detail {
// The rounding rule of the two clock functions, for a clock reading in seconds.
uint64_t roundedUnixTime(double seconds, double scale);
}  // namespace systemInfo_detail
