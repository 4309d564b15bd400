#include "daemon/event_loop.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <thread>
#include <vector>

namespace tarnel {
namespace {

using std::chrono::seconds;

TEST(EventLoop, EndsOnEitherSignalWithStatusZero) {
  for (const int number : {SIGTERM, SIGINT}) {
    EventLoop loop;
    ::kill(::getpid(), number);
    EXPECT_EQ(loop.run(), 0);
  }
}

TEST(EventLoop, ASecondSignalEndsTheProcess) {
  EXPECT_EXIT(
      {
        EventLoop loop;
        ::kill(::getpid(), SIGTERM);
        loop.run();
        ::kill(::getpid(), SIGTERM);
      },
      ::testing::KilledBySignal(SIGTERM), "");
}

TEST(EventLoop, RunsTheTimerThatWasSetLast) {
  EventLoop loop;
  std::vector<uint64_t> elapsed;
  loop.setTimerHandler([&](uint64_t generation) {
    elapsed.push_back(generation);
    loop.exit(3);
  });
  loop.armTimer(seconds(3600), 1);
  loop.armTimer(seconds(0), 2);
  EXPECT_EQ(loop.run(), 3);
  EXPECT_EQ(elapsed, std::vector<uint64_t>{2});
}

TEST(EventLoop, TimerMayBeSetFromAnyThreadAndAgain) {
  EventLoop loop;
  std::vector<uint64_t> elapsed;
  loop.setTimerHandler([&](uint64_t generation) {
    elapsed.push_back(generation);
    if (generation == 2) {
      loop.exit();
    } else {
      loop.armTimer(seconds(0), 2);
    }
  });
  std::thread([&loop] { loop.armTimer(seconds(0), 1); }).join();
  EXPECT_EQ(loop.run(), 0);
  EXPECT_EQ(elapsed, (std::vector<uint64_t>{1, 2}));
}

}  // namespace
}  // namespace tarnel
