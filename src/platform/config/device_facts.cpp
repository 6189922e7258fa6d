#include "platform/config/device_facts.h"

#include <toml++/toml.h>

#include <mutex>

#include "platform/log/log.h"

namespace platform {

namespace {

struct State {
  std::mutex mutex;
  std::filesystem::path path = "/etc/zlka/zlkad.toml";
  std::optional<DeviceFacts> facts;
};

State& state() {
  static State s;
  return s;
}

DeviceFacts load(const std::filesystem::path& path) {
  DeviceFacts facts;
  std::error_code ec;
  if (!std::filesystem::exists(path, ec)) return facts;
  toml::table table;
  try {
    table = toml::parse_file(path.string());
  } catch (const toml::parse_error& e) {
    log(LogLevel::Error, "Could not read device facts from %s: %s", path.string(), std::string(e.description()));
    return facts;
  }
  facts.internalBuild = table["device"]["internal_build"].value_or(false);
  if (auto cls = table["device"]["device_class"].value<std::string>()) facts.deviceClass = *cls;
  return facts;
}

const DeviceFacts& facts(State& s) {
  if (!s.facts) s.facts = load(s.path);
  return *s.facts;
}

}  // namespace

void setDeviceConfigPath(std::filesystem::path path) {
  State& s = state();
  std::lock_guard lock(s.mutex);
  s.path = std::move(path);
}

void setDeviceFacts(DeviceFacts f) {
  State& s = state();
  std::lock_guard lock(s.mutex);
  s.facts = std::move(f);
}

std::optional<bool> deviceAnswerBool(std::string_view fact) {
  State& s = state();
  std::lock_guard lock(s.mutex);
  if (fact == "InternalBuild") return facts(s).internalBuild;
  return std::nullopt;
}

std::optional<std::string> deviceAnswerString(std::string_view fact) {
  State& s = state();
  std::lock_guard lock(s.mutex);
  if (fact == "DeviceClass") return facts(s).deviceClass;
  return std::nullopt;
}

}  // namespace platform
