#include "platform/config/settings_store.h"

#include <gtest/gtest.h>

#include <fstream>
#include <thread>

#include "common/child_process.h"
#include "common/log_capture.h"

using platform::SettingsStore;
using platform::Value;

namespace {

namespace fs = std::filesystem;

class SettingsStoreTest : public testing::Test {
 protected:
  const zlkatest::TempDir temp;
  const fs::path dir = temp.path();
  SettingsStore store{"suite", dir};
};

TEST_F(SettingsStoreTest, BooleanIsATrueNumberOrYesTrueOneInAnyCase) {
  // clang-format off
  const std::pair<const char*, bool> rows[] = {
      {"true", true}, {"1", true}, {"0.5", true}, {"-1", true}, {"\"YES\"", true}, {"\"yEs\"", true}, {"\"TRUE\"", true},
      {"\"1\"", true}, {"false", false}, {"0", false}, {"\"no\"", false}, {"\"2\"", false}, {"\"yes \"", false},
      {"\"\"", false}, {"[1]", false}, {"{\"a\": 1}", false}, {"null", false},
  };
  // clang-format on
  std::string suite = "{";
  for (size_t i = 0; i < std::size(rows); ++i) suite += "\"k" + std::to_string(i) + "\": " + rows[i].first + ", ";
  std::ofstream(dir / "suite.json") << suite + R"("s": "ut"})";
  for (size_t i = 0; i < std::size(rows); ++i)
    EXPECT_EQ(store.boolForKey("k" + std::to_string(i)), rows[i].second) << rows[i].first;
  EXPECT_FALSE(store.boolForKey("missing"));
  EXPECT_EQ(store.stringForKey("s"), "ut");
  EXPECT_EQ(store.stringForKey("k1"), std::nullopt);  // strings only
}

TEST_F(SettingsStoreTest, EveryLookupSeesTheFileAsItIsNowAndABrokenOneIsLoggedOncePerChange) {
  zlkatest::LogCapture log;
  const std::pair<std::string, std::optional<std::string>> steps[] = {
      // the file, then what "Server" reads
      {"", std::nullopt},  // no file
      {R"({"Server": "ut"})", "ut"},
      {R"({"Server": "maint", "Custom": "x"})", "maint"},
      {"{broken", std::nullopt},  // empty, not the last good file
      {R"(["an array is not a suite"])", std::nullopt},
      {R"({"Server": "it"})", "it"},
      {"", std::nullopt},  // removed
  };
  for (const auto& [text, server] : steps) {
    text.empty() ? void(fs::remove(dir / "suite.json")) : void(std::ofstream(dir / "suite.json") << text);
    EXPECT_EQ(store.stringForKey("Server"), server) << text;
    EXPECT_EQ(store.stringForKey("Server"), server) << text;  // the unchanged file is not logged again
  }
  const auto lines = log.entries();
  ASSERT_EQ(lines.size(), 2u) << log.dump();
  EXPECT_TRUE(
      lines[0].message.starts_with("Settings suite suite is unreadable (" + (dir / "suite.json").string() + "): "));
  EXPECT_NE(lines[1].message.find("not a JSON object"), std::string::npos);
}

TEST_F(SettingsStoreTest, WritesAreAtomicAndConcurrentWritersLoseNothing) {
  SettingsStore fresh("suite", dir / "new-dir");
  ASSERT_TRUE(fresh.setObject("x", Value(true)));
  EXPECT_FALSE(fresh.setObject("bad", Value(platform::Data::fromString("bytes"))));  // no JSON form
  std::vector<std::jthread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&, t] {
      SettingsStore own("suite", dir / "new-dir");
      for (int i = 0; i < 10; ++i) own.setObject("k" + std::to_string(t) + "_" + std::to_string(i), Value(i));
    });
  threads.clear();
  EXPECT_EQ(fresh.dictionaryRepresentation().size(), 41u);
  ASSERT_TRUE(fresh.removeObject("x") && fresh.removeObject("never-there"));
  EXPECT_FALSE(fresh.objectForKey("x"));
  for (const auto& entry : fs::directory_iterator(dir / "new-dir"))  // no temporary left behind
    EXPECT_TRUE(entry.path().filename() == "suite.json" || entry.path().filename() == "suite.json.lock")
        << entry.path();
}

}  // namespace
