#include <gtest/gtest.h>

#include <mutex>
#include <thread>
#include <vector>

#include "platform/data.h"
#include "platform/error.h"
#include "platform/log.h"

using platform::LogLevel;

namespace {

struct Capture {
  std::mutex mutex;
  std::vector<platform::LogEntry> entries;
  explicit Capture(LogLevel minimum = LogLevel::Debug, bool privateData = false) {
    platform::configureLog({minimum, privateData, platform::LogBackend::Stderr, "test"});
    platform::setLogSink([this](const platform::LogEntry& e) {
      std::lock_guard lock(mutex);
      entries.push_back(e);
    });
  }
  ~Capture() {
    platform::setLogSink({});
    platform::configureLog({});
  }
  std::string last() { return entries.empty() ? "" : entries.back().message; }
};

template <class... A>
std::string fmt(std::string_view f, const A&... a) {
  if constexpr (sizeof...(A) == 0) {
    return platform::formatLogMessage(f, {}, false);
  } else {
    const platform::LogArg args[] = {platform::LogArg(a)...};
    return platform::formatLogMessage(f, args, false);
  }
}

}  // namespace

TEST(LogFormat, IntegerAndFloatDirectives) {
  EXPECT_EQ(fmt("%d %ld %lu %zu", -5, -6L, 7UL, size_t{8}), "-5 -6 7 8");
  EXPECT_EQ(fmt("%f|%.2f", 1.5, 2.0), "1.500000|2.00");
  EXPECT_EQ(fmt("%x %03d %%", 255u, 7), "ff 007 %");
  EXPECT_EQ(fmt("%d", uint64_t{18446744073709551615ULL}), "-1");
}

TEST(LogFormat, ObjectsStringsAndNil) {
  std::optional<platform::Error> none;
  std::optional<std::string> some = "x";
  EXPECT_EQ(fmt("%@ %@ %s %@", std::string("str"), platform::Data::fromString("\x01"), "cstr", none),
            "str {length = 1, bytes = 0x01} cstr (null)");
  EXPECT_EQ(fmt("%@", some), "x");
  EXPECT_EQ(fmt("%@", platform::Error("D", 3)), R"x(Error Domain=D Code=3 "The operation couldn't be completed. (D error 3.)")x");
  const char* nullText = nullptr;
  EXPECT_EQ(fmt("%s", nullText), "(null)");
}

TEST(LogFormat, PrivacyMarkers) {
  const platform::LogArg args[] = {std::string("secret"), std::string("open"), 42};
  EXPECT_EQ(platform::formatLogMessage("%{private}@ %{public}@ %{private}d", args, false), "<private> open <private>");
  EXPECT_EQ(platform::formatLogMessage("%{private}@ %{public}@ %{private}d", args, true), "secret open 42");
}

TEST(LogFormat, PointersAndMalformedFormats) {
  EXPECT_EQ(fmt("%p", uintptr_t{0x1234}), "0x1234");
  EXPECT_EQ(fmt("%p", static_cast<const void*>(nullptr)), "0x0");
  EXPECT_EQ(fmt("%d %d", 1), "1 <missing>");
  EXPECT_EQ(fmt("tail %"), "tail %");
  EXPECT_EQ(fmt("%{private"), "%{private");
  EXPECT_EQ(fmt("%q", 1), "%q");
}

TEST(Log, LevelsBelowTheMinimumAreNotFormatted) {
  Capture capture(LogLevel::Default);
  struct Counting {
    int* calls;
    std::string description() const {
      ++*calls;
      return "c";
    }
  };
  int calls = 0;
  platform::log(LogLevel::Debug, "%@", Counting{&calls});
  platform::log(LogLevel::Info, "%@", Counting{&calls});
  EXPECT_EQ(calls, 0);
  EXPECT_TRUE(capture.entries.empty());
  platform::log(LogLevel::Default, "%@", Counting{&calls});
  platform::log(LogLevel::Fault, "f");
  EXPECT_EQ(calls, 1);
  ASSERT_EQ(capture.entries.size(), 2u);
  EXPECT_EQ(capture.entries[1].level, LogLevel::Fault);
}

TEST(Log, PrivateDataSettingRevealsPrivateArguments) {
  {
    Capture capture(LogLevel::Debug, false);
    platform::log(LogLevel::Default, "token: %{private}@", std::string("abc"));
    EXPECT_EQ(capture.last(), "token: <private>");
  }
  Capture capture(LogLevel::Debug, true);
  platform::log(LogLevel::Default, "token: %{private}@", std::string("abc"));
  EXPECT_EQ(capture.last(), "token: abc");
}

TEST(Log, ModuleObjectsCarrySubsystemAndCategory) {
  Capture capture;
  auto log = platform::Log::create("com.example.sub", "cat");
  ASSERT_TRUE(log);
  platform::log(*log, LogLevel::Error, "x");
  ASSERT_EQ(capture.entries.size(), 1u);
  EXPECT_EQ(capture.entries[0].subsystem, "com.example.sub");
  EXPECT_EQ(capture.entries[0].category, "cat");
  EXPECT_FALSE(platform::Log::create("", "cat"));
  EXPECT_FALSE(platform::Log::create("sub", "bad\ncat"));
}

TEST(Log, ConcurrentWritersLoseNothing) {
  Capture capture;
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([t] {
      for (int i = 0; i < 200; ++i) platform::log(LogLevel::Info, "t%d i%d", t, i);
    });
  for (auto& th : threads) th.join();
  EXPECT_EQ(capture.entries.size(), 800u);
}

TEST(Log, LevelNamesAndJournalPriorities) {
  EXPECT_EQ(platform::logLevelFromName("fault"), LogLevel::Fault);
  EXPECT_EQ(platform::logLevelFromName("notice"), std::nullopt);
  EXPECT_EQ(platform::journalPriority(LogLevel::Fault), 2);
  EXPECT_EQ(platform::journalPriority(LogLevel::Default), 5);
  EXPECT_EQ(platform::journalPriority(LogLevel::Debug), 7);
}
