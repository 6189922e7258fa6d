#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "support/logging_modules.h"

using platform::LogLevel;

// Module set-up runs once per process, so each scenario runs in a child process and reports
// through its exit status.
namespace {

std::vector<platform::LogEntry>* captureAll() {
  static std::vector<platform::LogEntry> storage;
  auto* entries = &storage;
  platform::configureLog({LogLevel::Debug, false, platform::LogBackend::Stderr, "test"});
  platform::setLogSink([entries](const platform::LogEntry& e) { entries->push_back(e); });
  return entries;
}

bool has(const std::vector<platform::LogEntry>& entries, LogLevel level, const std::string& message) {
  for (const auto& e : entries)
    if (e.level == level && e.message == message) return true;
  return false;
}

int createsAndPublishes() {
  auto* log = captureAll();
  static LoggingModuleEntry_t table[] = {{"com.kestro.a", "one"}, {"com.kestro.b", "two"}};
  static LoggingModuleLog out[2];
  loggingModules_setup(table, 2, out);
  bool ok = out[0] && out[0]->subsystem() == "com.kestro.a" && out[1]->category() == "two" &&
            loggingModules_logs() == out && loggingModules_count() == 2 &&
            has(*log, LogLevel::Debug, "Created log object com.kestro.a: one") &&
            has(*log, LogLevel::Info, "Created 2 log object(s)!");
  return ok ? 0 : 1;
}

int zeroRows() {
  auto* log = captureAll();
  static LoggingModuleLog out[1];
  loggingModules_setup(nullptr, 0, out);
  bool ok = loggingModules_count() == 0 && loggingModules_logs() == out && log->size() == 1 &&
            has(*log, LogLevel::Info, "Created 0 log object(s)!");
  return ok ? 0 : 1;
}

int missingNames() {
  auto* log = captureAll();
  static LoggingModuleEntry_t table[] = {{"com.kestro.a", nullptr}, {nullptr, "cat"}, {"", "empty"}};
  static LoggingModuleLog out[3];
  loggingModules_setup(table, 3, out);
  bool ok = out[0] && out[0]->category() == "<Undefined>" && out[1] && out[1]->subsystem() == "<Undefined>" &&
            !out[2] && loggingModules_count() == 3 &&
            has(*log, LogLevel::Error, "Category missing for logging module 0!\n(Check LoggingModuleEntry_t table)") &&
            has(*log, LogLevel::Error, "Subsystem missing for logging module 1!\n(Check LoggingModuleEntry_t table)") &&
            has(*log, LogLevel::Error, "Failed to create log object : empty!") &&
            has(*log, LogLevel::Info, "Created 2 log object(s)!");
  return ok ? 0 : 1;
}

int secondSetUpIgnored() {
  captureAll();
  static LoggingModuleEntry_t first[] = {{"com.kestro.first", "c"}};
  static LoggingModuleEntry_t second[] = {{"com.kestro.second", "c"}, {"x", "y"}};
  static LoggingModuleLog outA[1], outB[2];
  std::thread t1([] { loggingModules_setup(first, 1, outA); });
  std::thread t2([] { loggingModules_setup(second, 2, outB); });
  t1.join();
  t2.join();
  const LoggingModuleLog* published = loggingModules_logs();
  bool ok = (published == outA && loggingModules_count() == 1 && !outB[0]) ||
            (published == outB && loggingModules_count() == 2 && !outA[0]);
  loggingModules_setup(second, 2, outB);
  ok = ok && loggingModules_logs() == published;
  return ok ? 0 : 1;
}

}  // namespace

TEST(LoggingModules, CreatesOneObjectPerRowAndPublishesThem) {
  EXPECT_EXIT(std::exit(createsAndPublishes()), testing::ExitedWithCode(0), "");
}

TEST(LoggingModules, ZeroRowsCreateNothingButStillPublish) {
  EXPECT_EXIT(std::exit(zeroRows()), testing::ExitedWithCode(0), "");
}

TEST(LoggingModules, MissingNamesBecomeUndefinedAndFailuresAreCountedOut) {
  EXPECT_EXIT(std::exit(missingNames()), testing::ExitedWithCode(0), "");
}

TEST(LoggingModules, SecondSetUpChangesNothingEvenWhenRacing) {
  EXPECT_EXIT(std::exit(secondSetUpIgnored()), testing::ExitedWithCode(0), "");
}
