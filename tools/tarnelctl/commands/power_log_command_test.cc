#include "tools/tarnelctl/commands/power_log_command.h"

#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <sstream>
#include <thread>

#include "tools/tarnelctl/power_log_journal.h"

namespace tarnel::ctl {
namespace {

using testing::HasSubstr;
using testing::StartsWith;

PowerLogRecord record(int32_t client) {
  return {.microseconds = 1700000000123456,
          .client = client,
          .eventName = "Halvend-TRN",
          .payload = Dictionary{{"a", client}}};
}

class PowerLogCommandTest : public testing::Test {
 protected:
  PowerLogCommandTest() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tarnelctl-power.XXXXXX").string();
    home_ = mkdtemp(pattern.data());
    options_.file = home_ + "/power.ndjson";
  }
  ~PowerLogCommandTest() override { std::filesystem::remove_all(home_); }

  void add(const std::string& text, const std::string& ending = "") const {
    std::ofstream(options_.file + ending, std::ios::app) << text;
  }
  static std::string shown(int32_t client) {
    const std::string number = std::to_string(client);
    return "2023-11-14 22:13:20.123456 +0000 client " + number + " Halvend-TRN {\"a\":" + number + "}\n";
  }

  std::string home_;
  PowerLogOptions options_;
  std::ostringstream out_;
  std::ostringstream err_;
  Terminal terminal_{out_, err_};
};

TEST_F(PowerLogCommandTest, RecordsAreShownFromTheOldestOn) {
  add(powerLogLine(record(2)) + powerLogLine(record(3)));
  add(powerLogLine(record(1)), ".1");
  EXPECT_EQ(showPowerLog(options_, terminal_), ExitStatus::ok);
  EXPECT_EQ(out_.str(), shown(1) + shown(2) + shown(3));
  EXPECT_EQ(err_.str(), "");
}

TEST_F(PowerLogCommandTest, OnlyTheLastAreShownOnRequest) {
  add(powerLogLine(record(2)) + powerLogLine(record(3)));
  add(powerLogLine(record(1)), ".1");
  options_.lines = 2;
  EXPECT_EQ(showPowerLog(options_, terminal_), ExitStatus::ok);
  EXPECT_EQ(out_.str(), shown(2) + shown(3));
}

TEST_F(PowerLogCommandTest, JsonIsOneLineForEachRecord) {
  add(powerLogLine(record(2)));
  options_.json = true;
  EXPECT_EQ(showPowerLog(options_, terminal_), ExitStatus::ok);
  EXPECT_EQ(out_.str(),
            "{\"time\":1700000000.123456,\"client\":2,\"event\":\"Halvend-TRN\",\"payload\":{\"a\":2}}\n");
}

TEST_F(PowerLogCommandTest, WhatWasTooLargeIsSaid) {
  EXPECT_EQ(
      powerLogText({.microseconds = -500000, .client = 1, .eventName = "E", .droppedBytes = 70000}, false),
      "1969-12-31 23:59:59.500000 +0000 client 1 E (70000 bytes, too large to be recorded)\n");
}

TEST_F(PowerLogCommandTest, LinesThatAreNoRecordsAreCounted) {
  add("nonsense\n" + powerLogLine(record(2)) + "{}\n" + "half a line");
  EXPECT_EQ(showPowerLog(options_, terminal_), ExitStatus::ok);
  EXPECT_EQ(out_.str(), shown(2));
  EXPECT_EQ(err_.str(), "tarnelctl: " + options_.file + ": 2 lines are no records and are not shown\n");
}

TEST_F(PowerLogCommandTest, OneLineThatIsNoRecordIsCounted) {
  add("nonsense\n" + powerLogLine(record(2)));
  EXPECT_EQ(showPowerLog(options_, terminal_), ExitStatus::ok);
  EXPECT_EQ(err_.str(), "tarnelctl: " + options_.file + ": 1 line is no record and is not shown\n");
}

TEST_F(PowerLogCommandTest, AnEmptyPowerLogIsSaid) {
  EXPECT_EQ(showPowerLog(options_, terminal_), ExitStatus::failed);
  EXPECT_EQ(err_.str(), "tarnelctl: no power log at " + options_.file + ": nothing was recorded yet\n");
}

TEST_F(PowerLogCommandTest, AFolderIsNoPowerLog) {
  options_.file = home_;
  EXPECT_EQ(showPowerLog(options_, terminal_), ExitStatus::failed);
  EXPECT_EQ(err_.str(), "tarnelctl: cannot read " + home_ + ": Is a directory\n");
}

// Takes what is printed, and ends the following once everything expected is there.
class Until final : public std::stringbuf {
 public:
  explicit Until(size_t lines) : lines_(lines) {}
  void setWhenReached(std::function<void(size_t)> whenReached) { whenReached_ = std::move(whenReached); }

 protected:
  int sync() override {
    const std::string text = str();
    const auto count = static_cast<size_t>(std::count(text.begin(), text.end(), '\n'));
    if (whenReached_) whenReached_(count);
    return count >= lines_ ? -1 : 0;
  }

 private:
  const size_t lines_;
  std::function<void(size_t)> whenReached_;
};

TEST_F(PowerLogCommandTest, FollowingGoesOnOverANewFile) {
  add(powerLogLine(record(1)));
  options_.follow = true;
  Until buffer(4);
  // Each step is taken once what was written before has been shown.
  std::thread writer;
  std::mutex mutex;
  std::condition_variable changed;
  size_t seen = 0;
  buffer.setWhenReached([&mutex, &changed, &seen](size_t count) {
    const std::lock_guard guard(mutex);
    seen = count;
    changed.notify_all();
  });
  writer = std::thread([this, &mutex, &changed, &seen] {
    const auto waitFor = [&mutex, &changed, &seen](size_t count) {
      std::unique_lock lock(mutex);
      changed.wait_for(lock, std::chrono::seconds(20), [&seen, count] { return seen >= count; });
    };
    waitFor(1);
    add(powerLogLine(record(2)).substr(0, 20));
    add(powerLogLine(record(2)).substr(20));
    waitFor(2);
    add(powerLogLine(record(3)));
    std::filesystem::rename(options_.file, options_.file + ".1");
    add(powerLogLine(record(4)));
  });
  std::ostream out(&buffer);
  const Terminal terminal{out, err_};
  EXPECT_EQ(showPowerLog(options_, terminal), ExitStatus::ok);
  writer.join();
  EXPECT_EQ(buffer.str(), shown(1) + shown(2) + shown(3) + shown(4));
}

TEST_F(PowerLogCommandTest, FollowingTakesAPathOfTheWorkingDirectory) {
  add(powerLogLine(record(1)));
  const auto before = std::filesystem::current_path();
  std::filesystem::current_path(home_);
  options_.file = "power.ndjson";
  options_.follow = true;
  Until buffer(1);
  std::ostream out(&buffer);
  EXPECT_EQ(showPowerLog(options_, {out, err_}), ExitStatus::ok);
  std::filesystem::current_path(before);
  EXPECT_EQ(buffer.str(), shown(1));
  EXPECT_EQ(err_.str(), "");
}

TEST(PowerLogFields, AreARecordWhenTheyAreComplete) {
  const std::string client = "28";
  const std::string event = "Halvend-TRN";
  const std::string payload = R"({"a":{"$data":"AP8="}})";
  const std::string dropped = "70000";
  auto found = powerLogRecordFromFields(5, &client, &event, &payload, nullptr);
  ASSERT_TRUE(found);
  EXPECT_EQ(found->microseconds, 5);
  EXPECT_EQ(found->client, 28);
  EXPECT_EQ(found->eventName, "Halvend-TRN");
  EXPECT_EQ(found->payload, Value(Dictionary{{"a", Data{0, 255}}}));
  found = powerLogRecordFromFields(5, &client, &event, nullptr, &dropped);
  ASSERT_TRUE(found);
  EXPECT_EQ(found->droppedBytes, 70000U);
  EXPECT_TRUE(found->payload.isNull());
  const std::string nonsense = "28x";
  EXPECT_FALSE(powerLogRecordFromFields(5, nullptr, &event, &payload, nullptr));
  EXPECT_FALSE(powerLogRecordFromFields(5, &nonsense, &event, &payload, nullptr));
  EXPECT_FALSE(powerLogRecordFromFields(5, &client, nullptr, &payload, nullptr));
  EXPECT_FALSE(powerLogRecordFromFields(5, &client, &event, &nonsense, nullptr));
}

TEST_F(PowerLogCommandTest, AJournalThatIsNotThereIsNamed) {
  options_.file.clear();
  options_.journalDirectory = home_ + "/none";
  EXPECT_EQ(showPowerLog(options_, terminal_), ExitStatus::failed);
  EXPECT_EQ(err_.str(), "tarnelctl: the journal cannot be opened: No such file or directory\n");
}

}  // namespace
}  // namespace tarnel::ctl
