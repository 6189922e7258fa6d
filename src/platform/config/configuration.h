// The daemon's configuration file (TOML, /etc/zlka/zlkad.toml by default).
//
// Required: [device] internal_build and device_class, [servers.prod] static_content and api,
// [sap] trust_anchor. Optional: [servers.it], [servers.ut], [servers.maint] (each complete when
// present), [tls] ca_file, [settings] suite_dir, [entitlements] dir, [service] max_workers,
// [log] level and private_data. Server values are absolute https base URLs; a trailing slash is dropped. Any
// problem is an error naming the file and the key; unknown keys are collected as warnings.
#pragma once

#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/config/device_facts.h"
#include "platform/log/log.h"
#include "platform/values/result.h"

namespace platform {

struct ServerEnvironment {
  std::string staticContent;  // base URL of the static-content server
  std::string api;            // base URL of the API (and secure-association) server
};

struct Configuration {
  std::filesystem::path path;
  DeviceFacts device;
  std::map<std::string, ServerEnvironment, std::less<>> servers;  // "prod" always, "it", "ut", "maint" when given
  std::string caFile;                                             // empty: the system store
  std::filesystem::path trustAnchor;
  std::filesystem::path settingsDirectory = "/var/lib/zlka/defaults";
  std::filesystem::path entitlementsDirectory = "/etc/zlka/entitlements.d";
  LogLevel logLevel = LogLevel::Default;
  bool privateData = false;
  unsigned maxWorkers = 64;           // [service] max_workers: threads that connection work may use
  std::vector<std::string> warnings;  // "zlkad.toml: unknown key 'x.y'"

  static constexpr char kDefaultPath[] = "/etc/zlka/zlkad.toml";
};

// loadConfiguration reads and checks the file at `path`; it returns the configuration, or a failure
// saying why ("<file>: <key>: <problem>") when the file cannot be used.
Result<Configuration> loadConfiguration(const std::filesystem::path& path);

// setCurrentConfiguration makes `configuration` the one in force for this process (set once at
// start-up; tests set their own). Holders of the previous one keep it.
void setCurrentConfiguration(Configuration configuration);
// currentConfiguration is the configuration in force, shared and never null: the defaults (no
// servers) until one is set.
std::shared_ptr<const Configuration> currentConfiguration();

// normalizedBaseURL returns `url` without a trailing slash when it is an absolute https URL with a
// host and no path, query or fragment, else nullopt.
std::optional<std::string> normalizedBaseURL(const std::string& url);

}  // namespace platform
