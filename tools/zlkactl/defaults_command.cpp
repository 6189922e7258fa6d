#include <algorithm>
#include <iterator>

#include "network/zlka_network_constants.h"
#include "platform/config/configuration.h"
#include "platform/config/settings_store.h"
#include "zlkactl/commands.h"
#include "zlkactl/output_format.h"
#include "zlkactl/token_input.h"

namespace zlkactl {

namespace {

bool daemonReads(const std::string& key) {
  return std::any_of(std::begin(ZLKAUserDefaultsKeys), std::end(ZLKAUserDefaultsKeys),
                     [&](const char* known) { return key == known; });
}

std::string knownKeys() {
  std::string list;
  for (const char* known : ZLKAUserDefaultsKeys) list += (list.empty() ? "" : ", ") + std::string(known);
  return list;
}

}  // namespace

int runDefaults(const Invocation& inv, std::ostream& out, std::ostream& err) {
  // A misspelt key would be written and silently ignored by the daemon.
  if (inv.command == Command::DefaultsWrite && !inv.force && !daemonReads(*inv.key))
    return fail(inv, err, kExitUsage,
                "zlkad reads no setting '" + *inv.key + "' (it reads " + knownKeys() + "); --force writes it anyway");
  platform::Result<platform::Configuration> configuration = platform::loadConfiguration(inv.configPath);
  if (!configuration) return fail(inv, err, kExitUsage, configuration.error());
  platform::SettingsStore store(ZLKAUserDefaultsDomain, configuration->settingsDirectory);
  const std::string path = store.filePath().string();

  switch (inv.command) {
    case Command::DefaultsRead: {
      if (!inv.key) {
        out << jsonText(platform::Value(store.dictionaryRepresentation()), true) << "\n";
        return kExitSuccess;
      }
      std::optional<platform::Value> value = store.objectForKey(*inv.key);
      if (!value)
        return fail(inv, err, kExitOperationFailed,
                    std::string(ZLKAUserDefaultsDomain) + " has no value for '" + *inv.key + "' (" + path + ")");
      out << jsonText(*value, true) << "\n";
      return kExitSuccess;
    }
    case Command::DefaultsWrite:
      if (!store.setObject(*inv.key, parseSettingsValue(*inv.value)))
        return fail(inv, err, kExitOperationFailed, "cannot write " + path);
      return kExitSuccess;
    default:
      if (!store.removeObject(*inv.key)) return fail(inv, err, kExitOperationFailed, "cannot write " + path);
      return kExitSuccess;
  }
}

}  // namespace zlkactl
