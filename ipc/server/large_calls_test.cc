#include "ipc/server/large_calls.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <future>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace tarnel {
namespace {

using Kind = LargeCalls::Kind;
using std::chrono::milliseconds;
using std::chrono::seconds;

constexpr milliseconds kNone{0};
constexpr milliseconds kLong{30'000};

TEST(LargeCallsTest, AUsersMessagesHaveRoomUpToTheBoundAndGiveItBack) {
  LargeCalls calls(100);
  auto first = calls.enter(1, Kind::prompt, 60, kNone);
  ASSERT_TRUE(first);
  EXPECT_FALSE(calls.enter(1, Kind::prompt, 41, kNone));
  const auto second = calls.enter(1, Kind::prompt, 40, kNone);
  EXPECT_TRUE(second);
  EXPECT_FALSE(calls.enter(1, Kind::prompt, 1, kNone));
  first.reset();
  EXPECT_TRUE(calls.enter(1, Kind::prompt, 60, kNone));
}

TEST(LargeCallsTest, UsersAndKindsDoNotWaitForEachOther) {
  LargeCalls calls(100);
  const auto first = calls.enter(1, Kind::upload, 100, kNone);
  EXPECT_FALSE(calls.enter(1, Kind::upload, 1, kNone));
  EXPECT_TRUE(calls.enter(1, Kind::prompt, 100, kNone));
  EXPECT_TRUE(calls.enter(2, Kind::upload, 100, kNone));
}

TEST(LargeCallsTest, AMessageBeyondTheBoundWorksAlone) {
  LargeCalls calls(100);
  auto alone = calls.enter(1, Kind::prompt, 1000, kNone);
  ASSERT_TRUE(alone);
  EXPECT_FALSE(calls.enter(1, Kind::prompt, 1, kNone));
  alone.reset();
  EXPECT_TRUE(calls.enter(1, Kind::prompt, 1, kNone));
}

TEST(LargeCallsTest, WhoWaitsGoesOnWhenRoomIsGivenBack) {
  LargeCalls calls(100);
  auto place = calls.enter(1, Kind::prompt, 100, kNone);
  std::atomic<bool> placeWasGivenBack{false};
  std::promise<void> begun;
  std::thread waiting([&calls, &begun, &placeWasGivenBack] {
    begun.set_value();
    EXPECT_TRUE(calls.enter(1, Kind::prompt, 50, kLong));
    EXPECT_TRUE(placeWasGivenBack);
  });
  begun.get_future().wait();
  placeWasGivenBack = true;
  place.reset();
  waiting.join();
}

// Several that wait at once: each begins to once the one before it does.
class LineTest : public ::testing::Test {
 protected:
  ~LineTest() override {
    for (auto& thread : threads_) thread.join();
  }
  void waitFor(size_t bytes, milliseconds limit = kLong) {
    threads_.emplace_back([this, bytes, limit] {
      const auto place = calls.enter(1, Kind::prompt, bytes, limit);
      const std::lock_guard lock(mutex_);
      events_.push_back((place ? "in " : "refused ") + std::to_string(bytes));
    });
    // Standing in line, it is what keeps everybody else out, even one who would fit beside the first.
    while (calls.waiting(1, Kind::prompt) < threads_.size() - over()) std::this_thread::yield();
  }
  size_t over() const {
    const std::lock_guard lock(mutex_);
    return events_.size();
  }
  std::vector<std::string> eventsOnce(size_t count) const {
    while (over() < count) std::this_thread::yield();
    const std::lock_guard lock(mutex_);
    return events_;
  }

  LargeCalls calls{100};

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> events_;
  std::vector<std::thread> threads_;
};

TEST_F(LineTest, ALargeOneIsNotOvertakenBySmallerOnes) {
  auto first = calls.enter(1, Kind::prompt, 60, kNone);
  auto second = calls.enter(1, Kind::prompt, 10, kNone);
  waitFor(90);
  // Either would find room, but is behind it.
  waitFor(5);
  EXPECT_FALSE(calls.enter(1, Kind::prompt, 5, kNone));
  second.reset();
  EXPECT_FALSE(calls.enter(1, Kind::prompt, 5, kNone));
  EXPECT_EQ(over(), 0U);
  first.reset();
  const auto events = eventsOnce(2);
  EXPECT_EQ(std::count(events.begin(), events.end(), "in 90"), 1);
  EXPECT_EQ(std::count(events.begin(), events.end(), "in 5"), 1);
}

TEST_F(LineTest, WhenTheFirstGivesUpThoseBehindItGoOn) {
  const auto working = calls.enter(1, Kind::prompt, 60, kNone);
  waitFor(90, milliseconds(200));
  waitFor(40);
  EXPECT_EQ(eventsOnce(2).size(), 2U);
  const auto events = eventsOnce(2);
  EXPECT_EQ(std::count(events.begin(), events.end(), "refused 90"), 1);
  EXPECT_EQ(std::count(events.begin(), events.end(), "in 40"), 1);
}

TEST_F(LineTest, AfterTheStopNobodyWaitsAndNobodyEnters) {
  auto working = calls.enter(1, Kind::prompt, 100, kNone);
  waitFor(90);
  waitFor(40);
  EXPECT_FALSE(calls.stopped());
  calls.stop();
  EXPECT_TRUE(calls.stopped());
  EXPECT_EQ(eventsOnce(2).size(), 2U);
  for (const auto& event : eventsOnce(2)) EXPECT_TRUE(event.starts_with("refused")) << event;
  working.reset();
  EXPECT_FALSE(calls.enter(1, Kind::prompt, 1, kLong));
  EXPECT_FALSE(calls.enter(2, Kind::upload, 1, kLong));
}

TEST(LargeCallsTest, MemoryIsTrimmedSeldomAndOnlyWhenNobodyIsAtWork) {
  size_t trims = 0;
  size_t told = 0;
  LargeCalls::SteadyTime now{};
  LargeCalls calls(
      100, {.trim = [&trims] { ++trims; }, .owed = [&told] { ++told; }, .now = [&now] { return now; }});
  const auto work = [&calls](uint32_t uid, size_t bytes) { calls.enter(uid, Kind::prompt, bytes, kNone); };
  work(1, 99);
  EXPECT_EQ(told, 0U) << "there is not enough to give back";
  EXPECT_EQ(calls.trimOwed(), std::nullopt);
  {
    const auto other = calls.enter(2, Kind::upload, 10, kNone);
    for (int i = 0; i < 10; ++i) work(1, 100);
    EXPECT_EQ(told, 0U) << "another user's call is at work";
    EXPECT_EQ(calls.trimOwed(), std::nullopt);
    EXPECT_EQ(trims, 0U);
  }
  EXPECT_EQ(told, 1U);
  EXPECT_EQ(trims, 0U) << "not on the thread of a message";
  EXPECT_EQ(calls.trimOwed(), std::nullopt);
  EXPECT_EQ(trims, 1U);
  // A moment later it has to wait.
  now += seconds(2);
  work(1, 100);
  EXPECT_EQ(told, 2U);
  EXPECT_EQ(calls.trimOwed(), seconds(8));
  now += seconds(8) - milliseconds(1);
  EXPECT_EQ(calls.trimOwed(), milliseconds(1));
  EXPECT_EQ(trims, 1U);
  now += milliseconds(1);
  EXPECT_EQ(calls.trimOwed(), std::nullopt);
  EXPECT_EQ(trims, 2U);
  now += seconds(20);
  EXPECT_EQ(calls.trimOwed(), std::nullopt);
  EXPECT_EQ(trims, 2U) << "nothing is owed";
}

}  // namespace
}  // namespace tarnel
