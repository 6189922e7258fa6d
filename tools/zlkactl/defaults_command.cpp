#include "platform/configuration.h"
#include "platform/settings_store.h"
#include "zlkactl/commands.h"
#include "zlkactl/output_format.h"
#include "zlkactl/token_input.h"

namespace zlkactl {

namespace {

constexpr char kSuiteName[] = "com.kestro.ZLKAuthentication";

}  // namespace

int runDefaults(const Invocation& inv, std::ostream& out, std::ostream& err) {
  std::string problem;
  std::optional<platform::Configuration> configuration = platform::loadConfiguration(inv.configPath, &problem);
  if (!configuration) {
    err << "zlkactl: " << problem << "\n";
    return kExitUsage;
  }
  platform::SettingsStore store(kSuiteName, configuration->settingsDirectory);
  const std::string path = store.filePath().string();

  switch (inv.command) {
    case Command::DefaultsRead: {
      if (!inv.key) {
        out << jsonText(platform::Value(store.dictionaryRepresentation()), true) << "\n";
        return kExitSuccess;
      }
      std::optional<platform::Value> value = store.objectForKey(*inv.key);
      if (!value) {
        err << "zlkactl: " << kSuiteName << " has no value for '" << *inv.key << "' (" << path << ")\n";
        return kExitOperationFailed;
      }
      out << jsonText(*value, true) << "\n";
      return kExitSuccess;
    }
    case Command::DefaultsWrite:
      if (!store.setObject(*inv.key, parseSettingsValue(*inv.value))) {
        err << "zlkactl: cannot write " << path << "\n";
        return kExitOperationFailed;
      }
      return kExitSuccess;
    default:
      if (!store.removeObject(*inv.key)) {
        err << "zlkactl: cannot write " << path << "\n";
        return kExitOperationFailed;
      }
      return kExitSuccess;
  }
}

}  // namespace zlkactl
