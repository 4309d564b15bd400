#include "platform/linux/ipc/large_calls.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <thread>

namespace tarnel {
namespace {

using Kind = LargeCalls::Kind;
using std::chrono::milliseconds;

constexpr milliseconds kNone{0};

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
  std::atomic<bool> isOver{false};
  std::promise<void> begun;
  std::thread waiting([&calls, &begun, &isOver] {
    begun.set_value();
    EXPECT_TRUE(calls.enter(1, Kind::prompt, 50));
    isOver = true;
  });
  begun.get_future().wait();
  EXPECT_FALSE(isOver);
  place.reset();
  waiting.join();
  EXPECT_TRUE(isOver);
}

}  // namespace
}  // namespace tarnel
