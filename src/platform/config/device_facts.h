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

// setDeviceConfigPath names the file to read; it takes effect only before the first query.
void setDeviceConfigPath(std::filesystem::path path);
// setDeviceFacts replaces the facts, read or not (tools and tests that run without a file).
void setDeviceFacts(DeviceFacts facts);

// deviceAnswerBool answers "InternalBuild"; nullopt for any other fact.
std::optional<bool> deviceAnswerBool(std::string_view fact);
// deviceAnswerString answers "DeviceClass" (nullopt when the file names none); nullopt for any
// other fact.
std::optional<std::string> deviceAnswerString(std::string_view fact);

}  // namespace platform
