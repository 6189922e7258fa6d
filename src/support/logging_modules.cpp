#include "support/logging_modules.h"

#include <atomic>
#include <mutex>
#include <string>

using platform::LogLevel;

namespace {
std::once_flag gSetupOnce;
std::atomic<const LoggingModuleLog*> gModules{nullptr};
std::atomic<uint8_t> gModuleCount{0};
constexpr char kUndefined[] = "<Undefined>";
}  // namespace

void loggingModules_setup(const LoggingModuleEntry_t* table, uint8_t count, LoggingModuleLog* out) {
  std::call_once(gSetupOnce, [&] {
    int created = 0;
    for (int n = 0; n < count; ++n) {
      const char* subsystem = table[n].subsystem;
      const char* category = table[n].category;
      if (!subsystem) {
        platform::log(LogLevel::Error, "Subsystem missing for logging module %d!\n(Check LoggingModuleEntry_t table)",
                      n);
        subsystem = kUndefined;
      }
      if (!category) {
        platform::log(LogLevel::Error, "Category missing for logging module %d!\n(Check LoggingModuleEntry_t table)",
                      n);
        category = kUndefined;
      }
      out[n] = platform::Log::create(subsystem, category);
      if (out[n]) {
        ++created;
        platform::log(LogLevel::Debug, "Created log object %s: %s", subsystem, category);
      } else {
        platform::log(LogLevel::Error, "Failed to create log object %s: %s!", subsystem, category);
      }
    }
    platform::log(LogLevel::Info, "Created %d log object(s)!", created);
    gModules.store(out);
    gModuleCount.store(count);
  });
}

const LoggingModuleLog* loggingModules_logs() { return gModules.load(); }
uint8_t loggingModules_count() { return gModuleCount.load(); }
