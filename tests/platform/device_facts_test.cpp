#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "platform/device_facts.h"
#include "platform/process_memory.h"

// Device facts are read once per process, so each scenario runs in a child process.
TEST(DeviceFacts, ReadsTheDeviceTableOnce) {
  EXPECT_EXIT(
      {
        auto path = std::filesystem::temp_directory_path() / ("facts-" + std::to_string(getpid()) + ".toml");
        std::ofstream(path) << "[device]\ninternal_build = true\ndevice_class = \"AccessoryHub\"\n";
        platform::setDeviceConfigPath(path);
        bool ok = platform::deviceAnswerBool("InternalBuild") == true &&
                  platform::deviceAnswerString("DeviceClass") == "AccessoryHub" &&
                  !platform::deviceAnswerBool("Unknown");
        std::ofstream(path) << "[device]\ninternal_build = false\n";
        ok = ok && platform::deviceAnswerBool("InternalBuild") == true;  // not read again
        std::filesystem::remove(path);
        std::exit(ok ? 0 : 1);
      },
      testing::ExitedWithCode(0), "");
}

TEST(DeviceFacts, MissingOrBrokenFileAnswersProduction) {
  EXPECT_EXIT(
      {
        platform::setDeviceConfigPath("/nonexistent/zlkad.toml");
        std::exit(platform::deviceAnswerBool("InternalBuild") == false && !platform::deviceAnswerString("DeviceClass") ? 0 : 1);
      },
      testing::ExitedWithCode(0), "");
  EXPECT_EXIT(
      {
        auto path = std::filesystem::temp_directory_path() / ("broken-" + std::to_string(getpid()) + ".toml");
        std::ofstream(path) << "[device\ninternal_build = yes\n";
        platform::setDeviceConfigPath(path);
        bool ok = platform::deviceAnswerBool("InternalBuild") == false;
        std::filesystem::remove(path);
        std::exit(ok ? 0 : 1);
      },
      testing::ExitedWithCode(0), "Could not read device facts");
}

TEST(ProcessMemory, GrowsWithTouchedMemory) {
  auto before = platform::readProcessMemory();
  ASSERT_TRUE(before);
  EXPECT_GT(before->resident, 0u);
  EXPECT_GE(before->virtualSize, before->resident);
  std::vector<char> block(64 << 20, 1);
  auto after = platform::readProcessMemory();
  ASSERT_TRUE(after);
  EXPECT_GT(after->footprint, before->footprint + (32u << 20));
  EXPECT_EQ(block[12345], 1);
}
