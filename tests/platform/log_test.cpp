#include "platform/log/log.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "common/log_capture.h"
#include "platform/values/data.h"

using platform::LogArg;
using platform::LogLevel;

namespace {

struct Counting {  // counts how often it is formatted
  int* calls;
  std::string description() const { return std::to_string(++*calls); }
};

TEST(LogFormat, DirectivesFormatTheirArgumentsAndPrivateOnesAreRedacted) {
  const char* nullText = nullptr;
  const std::optional<platform::Data> none;
  const std::optional<std::string> some = "x";
  struct Row {
    const char* format;
    std::vector<LogArg> args;
    std::string redacted;
    std::string shown = "";  // with private data on, when it differs
  };
  // clang-format off
  const Row rows[] = {
      {"%d %i %ld %lu %zu %hhd", {-5, 4, -6L, 7UL, size_t{8}, 9}, "-5 4 -6 7 8 9"},
      {"%x %X %o %03d %-3d| %+d %%", {255u, 255u, 8u, 7, 7, 7}, "ff FF 10 007 7  | +7 %"},
      {"%d %u", {UINT64_MAX, -1}, "-1 18446744073709551615"},  // read as the directive says
      {"%f|%.2f|%e|%g|%d", {1.5, 2, 1.0, 0.25, 3.9}, "1.500000|2.00|1.000000e+00|0.25|3"},
      {"%c%c", {'o', 107}, "ok"},
      {"%@ %@ %s %@ %@ %s", {std::string("str"), platform::Data::fromString("\x01"), "cstr", none, some, nullText},
       "str {length = 1, bytes = 0x01} cstr (null) x (null)"},
      {"%@ %@ %@", {42, -1.5, true}, "42 -1.5 1"},
      {"%p %p", {uintptr_t{0x1234}, static_cast<const void*>(nullptr)}, "0x1234 0x0"},
      {"%d %d", {1}, "1 <missing>"},
      {"%q %d", {1}, "%q 1"},  // an unknown directive stays visible and takes no argument
      {"tail %", {}, "tail %"},
      {"%{private", {1}, "%{private"},
      {"%5", {1}, "%5"}, {"%5l", {1}, "%5l"},  // cut short in the flags, in the length
      // A long argument is cut at a character boundary (here inside the two bytes of "é").
      {"%@", {std::string(4095, 'a') + "\u00e9" + std::string(10, 'b')}, std::string(4095, 'a') + "... (12 more bytes)"},
      {"%{private}@ %{public}@ %{private}d %{ private, mask }s", {std::string("secret"), std::string("open"), 42, "m"},
       "<private> open <private> <private>", "secret open 42 m"},
  };
  // clang-format on
  for (const Row& r : rows) {
    EXPECT_EQ(platform::formatLogMessage(r.format, r.args, false), r.redacted) << r.format;
    EXPECT_EQ(platform::formatLogMessage(r.format, r.args, true), r.shown.empty() ? r.redacted : r.shown) << r.format;
  }
}

TEST(Log, EntriesBelowTheMinimumAreNeitherFormattedNorWrittenAndPrivateDataRevealsPrivateArguments) {
  for (bool privateData : {false, true}) {
    zlkatest::LogCapture capture;
    platform::configureLog({LogLevel::Default, privateData, platform::LogBackend::Stderr, "test"});
    int calls = 0;
    platform::log(LogLevel::Debug, "%@", Counting{&calls});
    platform::log(LogLevel::Info, "%@", Counting{&calls});
    EXPECT_EQ(calls, 0);
    platform::log(LogLevel::Default, "%@ %{private}@", Counting{&calls}, std::string("abc"));
    platform::log(*platform::Log::create("com.example.sub", "cat"), LogLevel::Fault, "f");
    const auto e = capture.entries();
    ASSERT_EQ(e.size(), 2u);
    EXPECT_EQ(std::tuple(e[0].message, e[0].subsystem + e[0].category),
              std::tuple(privateData ? "1 abc" : "1 <private>", ""));
    EXPECT_EQ(std::tuple(e[1].level, e[1].subsystem + "/" + e[1].category),
              std::tuple(LogLevel::Fault, "com.example.sub/cat"));
  }
}

TEST(Log, StderrLinesCarryTimeIdentifierLevelAndModuleAndStayOneLine) {
  platform::configureLog({LogLevel::Debug, false, platform::LogBackend::Stderr, "test"});
  testing::internal::CaptureStderr();
  platform::log(*platform::Log::create("com.example.sub", "cat"), LogLevel::Error, "a\nb");
  // A server's body or a caller's string must not end the line, forge another or colour a terminal.
  platform::log(LogLevel::Info, "%@", std::string("\r\x1b[31mforged\t\x7f\0.", 16));
  const std::string out = testing::internal::GetCapturedStderr(), pid = std::to_string(getpid());
  platform::configureLog({});
  const std::string stamp = "[0-9]{4}-[0-9]{2}-[0-9]{2} [0-9]{2}:[0-9]{2}:[0-9]{2}\\.[0-9]{3} test\\[" + pid + "\\] ";
  EXPECT_THAT(out, testing::MatchesRegex(stamp + "<error> \\[com\\.example\\.sub:cat\\] a\\\\nb\n" + stamp +
                                         "<info> \\\\r\\\\x1b\\[31mforged\\\\t\\\\x7f\\\\x00\\.\n"));
  using Names = std::pair<const char*, const char*>;  // module names must be printable and not empty
  for (auto [subsystem, category] :
       {Names{"", "cat"}, Names{"sub", ""}, Names{"sub", "bad\ncat"}, Names{"bad\x7f", "c"}, Names{"s\x1f", "c"}})
    EXPECT_FALSE(platform::Log::create(subsystem, category)) << subsystem << "/" << category;
  EXPECT_TRUE(platform::Log::create("sub system", "a category"));
}

TEST(Log, JournalEntriesNameTheCallersPlaceTheirModuleAndTheirEvent) {
  zlkatest::LogCapture capture;
  const unsigned line = __LINE__ + 1;
  platform::log(LogLevel::Default, platform::MessageID{"3b3c29f1b71344dbb4e0a7e61382ddca"}, "opened %d", 1);
  const auto e = capture.entries();
  ASSERT_EQ(e.size(), 1u);
  // The call's place, not the log back end's.
  EXPECT_EQ(std::tuple(e[0].file, e[0].line, e[0].messageID),
            std::tuple("tests/platform/log_test.cpp", line, "3b3c29f1b71344dbb4e0a7e61382ddca"));
  EXPECT_EQ(e[0].function, "TestBody");
  using Fields = std::vector<std::string>;
  platform::LogEntry entry{LogLevel::Error, "", "", "m", "src/platform/bus/listener.cpp", 7, "run", ""};
  EXPECT_EQ(platform::journalFields(entry, "zlkad"),
            (Fields{"MESSAGE=m", "PRIORITY=3", "SYSLOG_IDENTIFIER=zlkad", "ZLKA_SUBSYSTEM=com.kestro.ZLKAuthentication",
                    "ZLKA_CATEGORY=bus", "CODE_FILE=src/platform/bus/listener.cpp", "CODE_LINE=7", "CODE_FUNC=run"}));
  // A log object's own names win; the default log's category is the module of the call.
  // clang-format off
  entry = {LogLevel::Fault, "com.example.sub", "cat", "m", "src/network/metadata_query.cpp", 1, "f", "6113ffeebbf84fa0b42d7f30bad01cc9"};
  // clang-format on
  EXPECT_THAT(platform::journalFields(entry, "zlkad"),
              testing::IsSupersetOf({"ZLKA_SUBSYSTEM=com.example.sub", "ZLKA_CATEGORY=cat",
                                     "MESSAGE_ID=6113ffeebbf84fa0b42d7f30bad01cc9"}));
  entry.subsystem = "";
  EXPECT_THAT(platform::journalFields(entry, "zlkad"), testing::Contains("ZLKA_CATEGORY=network"));
}

TEST(Log, LevelNamesAndJournalPriorities) {
  for (const auto& [level, name, priority] : {std::tuple{LogLevel::Debug, "debug", 7},
                                              {LogLevel::Info, "info", 6},
                                              {LogLevel::Default, "default", 5},
                                              {LogLevel::Error, "error", 3},
                                              {LogLevel::Fault, "fault", 2}}) {
    EXPECT_EQ(platform::logLevelName(level), name);
    EXPECT_EQ(platform::logLevelFromName(name), level);
    EXPECT_EQ(platform::journalPriority(level), priority);
  }
  EXPECT_EQ(platform::logLevelFromName("notice"), std::nullopt);
}

}  // namespace
