// The message log on a real file system.

#include <gtest/gtest.h>
#include <stdlib.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <thread>
#include <vector>

#include "platform/fake/fake_world.h"
#include "platform/linux/system/linux_file_system.h"
#include "util/message_log.h"

namespace tarnel {
namespace {

class MessageLogFilesTest : public testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = testing::TempDir() + "message_log_XXXXXX";
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    root_ = pattern;
    dependencies_.messageLogDirectory = root_ / "Logs" / "Retired";
    using namespace std::chrono;
    realNow_ = duration_cast<seconds>(system_clock::now().time_since_epoch()).count();
    world_.clock.set({realNow_, 0});
  }
  void TearDown() override { std::filesystem::remove_all(root_); }

  std::string pathOf(int64_t seconds) const {
    return dependencies_.messageLogDirectory + "/tarneld_" + std::to_string(seconds) + "_messageLog.diag";
  }
  static std::string textOf(const std::string& path) {
    std::ifstream file(path);
    return {std::istreambuf_iterator<char>(file), {}};
  }

  std::filesystem::path root_;
  int64_t realNow_ = 0;
  fake::FakeWorld world_;
  LinuxFileSystem files_;
  Dependencies dependencies_ = world_.withFiles(files_);
};

TEST_F(MessageLogFilesTest, DirectoryAndFileAreMadeAndAppendedTo) {
  writeToLogFile(dependencies_, "first %d", 1);
  writeToLogFile(dependencies_, "second");
  const std::string date = "(" + description(Date{static_cast<double>(realNow_)}) + ") ";
  EXPECT_EQ(textOf(pathOf(realNow_)), date + "first 1\n" + date + "second\n");
}

TEST_F(MessageLogFilesTest, AFileOfTheDayBeforeIsReplaced) {
  writeToLogFile(dependencies_, "first");
  world_.clock.advance(86400 + 60);
  writeToLogFile(dependencies_, "second");
  EXPECT_FALSE(std::filesystem::exists(pathOf(realNow_)));
  EXPECT_TRUE(textOf(pathOf(realNow_ + 86400 + 60)).ends_with(") second\n"));
}

TEST_F(MessageLogFilesTest, DirectoryThatCannotBeMadeLosesTheMessageOnly) {
  std::ofstream(root_ / "Logs") << "a file is in the way";
  writeToLogFile(dependencies_, "message");
  EXPECT_TRUE(world_.log.contains(
      LogLevel::error, "writeToLogFile: Failed to create new tarneld log file " + pathOf(realNow_)));
}

// No lock is taken; all that is promised is that whole lines arrive and nothing breaks.
TEST_F(MessageLogFilesTest, ThreadsAppendWholeLines) {
  writeToLogFile(dependencies_, "start");
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([this] {
      for (int round = 0; round < 25; ++round) {
        writeToLogFile(dependencies_, "%s", std::string(3000, 'x').c_str());
      }
    });
  }
  for (auto& thread : threads) thread.join();
  std::ifstream file(pathOf(realNow_));
  std::string line;
  size_t whole = 0;
  while (std::getline(file, line)) whole += line.ends_with(") " + std::string(3000, 'x')) ? 1 : 0;
  EXPECT_EQ(whole, 100U);
}

}  // namespace
}  // namespace tarnel
