// Device facts: the answers to "InternalBuild" and "DeviceClass", read once per process from the
// [device] table of the configuration file (internal_build, device_class). A missing file or table
// answers "not internal" and no device class.
#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

struct DeviceFacts {
  bool internalBuild = false;
  std::optional<std::string> deviceClass;
};

// The file to read; takes effect if called before the first query.
void setDeviceConfigPath(std::filesystem::path path);
// Replaces the facts (tools and tests that run without a configuration file).
void setDeviceFacts(DeviceFacts facts);

// nullopt for a fact this device does not know.
std::optional<bool> deviceAnswerBool(std::string_view fact);
std::optional<std::string> deviceAnswerString(std::string_view fact);

}  // namespace platform
