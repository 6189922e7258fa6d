#include "support/logging_modules.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <thread>
#include <vector>

using platform::LogLevel;

namespace {

// Set-up runs once per process, so each scenario runs in a child process, which exits 0 when the
// modules and the log lines are as expected.
std::vector<std::pair<LogLevel, std::string>> gLines;

void setUp(const std::vector<LoggingModuleEntry_t>& table, LoggingModuleLog* out) {
  platform::configureLog({LogLevel::Debug, false, platform::LogBackend::Stderr, "test"});
  platform::setLogSink([](const platform::LogEntry& e) { gLines.emplace_back(e.level, e.message); });
  loggingModules_setup(table.data(), static_cast<uint8_t>(table.size()), out);
}

bool logged(LogLevel level, const std::string& message) {
  return std::find(gLines.begin(), gLines.end(), std::pair(level, message)) != gLines.end();
}

TEST(LoggingModules, CreatesOneObjectPerRowNamingMissingNamesUndefinedAndCountsOnlyThoseMade) {
  EXPECT_EXIT(
      {
        static LoggingModuleLog out[4];
        setUp({{"com.kestro.a", "one"}, {"com.kestro.a", nullptr}, {nullptr, "cat"}, {"", "empty"}}, out);
        bool ok =
            out[0]->subsystem() == "com.kestro.a" && out[0]->category() == "one" &&
            out[1]->category() == "<Undefined>" && out[2]->subsystem() == "<Undefined>" && !out[3] &&
            loggingModules_logs() == out && loggingModules_count() == 4 &&
            logged(LogLevel::Debug, "Created log object com.kestro.a: one") &&
            logged(LogLevel::Error, "Category missing for logging module 1!\n(Check LoggingModuleEntry_t table)") &&
            logged(LogLevel::Error, "Subsystem missing for logging module 2!\n(Check LoggingModuleEntry_t table)") &&
            logged(LogLevel::Error, "Failed to create log object : empty!") &&
            logged(LogLevel::Info, "Created 3 log object(s)!");
        std::exit(ok ? 0 : 1);
      },
      testing::ExitedWithCode(0), "");
}

TEST(LoggingModules, ASecondSetUpChangesNothingEvenWhenRacing) {
  EXPECT_EXIT(
      {
        static LoggingModuleLog a[1];
        static LoggingModuleLog b[2];
        std::thread first([] { setUp({{"com.kestro.first", "c"}}, a); });
        std::thread second([] { setUp({{"com.kestro.second", "c"}, {"x", "y"}}, b); });
        first.join();
        second.join();
        const LoggingModuleLog* published = loggingModules_logs();
        bool ok = (published == a && loggingModules_count() == 1 && !b[0]) ||
                  (published == b && loggingModules_count() == 2 && !a[0]);
        setUp({{"com.kestro.third", "c"}}, b);
        std::exit(ok && loggingModules_logs() == published ? 0 : 1);
      },
      testing::ExitedWithCode(0), "");
}

}  // namespace
