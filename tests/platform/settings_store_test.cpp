#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>
#include <vector>

#include "platform/log.h"
#include "platform/settings_store.h"

using platform::SettingsStore;
using platform::Value;

namespace {
class SettingsStoreTest : public testing::Test {
 protected:
  std::filesystem::path dir = std::filesystem::temp_directory_path() / ("zlka-settings-" + std::to_string(getpid()));
  void SetUp() override { std::filesystem::create_directories(dir); }
  void TearDown() override { std::filesystem::remove_all(dir); }
  void write(const std::string& text) { std::ofstream(dir / "suite.json") << text; }
};
}  // namespace

TEST_F(SettingsStoreTest, BooleanLookupAcceptsTheUsualSpellings) {
  write(R"({"t": true, "f": false, "one": 1, "zero": 0, "half": 0.5, "YES": "YES", "yes": "yEs", "true": "TRUE",
            "s1": "1", "no": "no", "s2": "2", "arr": [1], "null": null})");
  SettingsStore store("suite", dir);
  for (const char* key : {"t", "one", "half", "YES", "yes", "true", "s1"}) EXPECT_TRUE(store.boolForKey(key)) << key;
  for (const char* key : {"f", "zero", "no", "s2", "arr", "null", "missing"}) EXPECT_FALSE(store.boolForKey(key)) << key;
  EXPECT_EQ(store.stringForKey("no"), "no");
  EXPECT_EQ(store.stringForKey("one"), std::nullopt);
  EXPECT_EQ(store.stringForKey("missing"), std::nullopt);
}

TEST_F(SettingsStoreTest, ChangesActAtTheNextLookup) {
  SettingsStore store("suite", dir);
  EXPECT_EQ(store.stringForKey("Server"), std::nullopt);  // no file yet
  write(R"({"Server": "ut"})");
  EXPECT_EQ(store.stringForKey("Server"), "ut");
  write(R"({"Server": "maint", "CustomServer": "https://x"})");  // same size class, new content
  EXPECT_EQ(store.stringForKey("Server"), "maint");
  std::filesystem::remove(dir / "suite.json");
  EXPECT_EQ(store.stringForKey("Server"), std::nullopt);
}

TEST_F(SettingsStoreTest, UnparsableFileReadsEmptyAndIsLoggedOncePerChange) {
  std::vector<std::string> lines;
  platform::configureLog({platform::LogLevel::Debug, false, platform::LogBackend::Stderr, "test"});
  platform::setLogSink([&](const platform::LogEntry& e) { lines.push_back(e.message); });
  write("{broken");
  SettingsStore store("suite", dir);
  EXPECT_FALSE(store.boolForKey("a"));
  EXPECT_FALSE(store.boolForKey("a"));
  EXPECT_EQ(lines.size(), 1u);
  write("[\"an array is not a suite\"]");
  EXPECT_FALSE(store.boolForKey("a"));
  EXPECT_EQ(lines.size(), 2u);
  platform::setLogSink({});
  platform::configureLog({});
}

TEST_F(SettingsStoreTest, WritesAreAtomicAndConcurrentWritersLoseNothing) {
  SettingsStore a("suite", dir / "new-dir");
  ASSERT_TRUE(a.setObject("x", Value(true)));
  EXPECT_TRUE(a.boolForKey("x"));
  EXPECT_FALSE(a.setObject("bad", Value(platform::Data::fromString("bytes"))));
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&, t] {
      SettingsStore own("suite", dir / "new-dir");
      for (int i = 0; i < 10; ++i) own.setObject("k" + std::to_string(t) + "_" + std::to_string(i), Value(i));
    });
  for (auto& th : threads) th.join();
  EXPECT_EQ(a.dictionaryRepresentation().size(), 41u);
  ASSERT_TRUE(a.removeObject("x"));
  EXPECT_FALSE(a.objectForKey("x"));
  EXPECT_TRUE(a.removeObject("never-there"));
  for (const auto& entry : std::filesystem::directory_iterator(dir / "new-dir"))
    EXPECT_TRUE(entry.path().filename() == "suite.json" || entry.path().filename() == "suite.json.lock") << entry.path();
}
