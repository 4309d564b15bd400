#include "platform/linux/queues/asio_work_queues_test_support.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <future>
#include <stdexcept>
#include <thread>
#include <vector>

// Tasks of the queues, and the end of the thread that runs them.

namespace tarnel {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

size_t descriptors() {
  return static_cast<size_t>(std::distance(std::filesystem::directory_iterator("/proc/self/fd"),
                                           std::filesystem::directory_iterator()));
}

TEST_F(AsioWorkQueuesTest, TasksRunInOrderOnOneOtherThread) {
  const auto queue = queues->makeQueue("com.example.one");
  std::vector<int> order;
  std::vector<std::thread::id> threads;
  for (int i = 0; i < 1000; ++i) {
    queue->async([&order, &threads, i] {
      order.push_back(i);
      threads.push_back(std::this_thread::get_id());
    });
  }
  settle(*queue);
  ASSERT_EQ(order.size(), 1000U);
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(order[static_cast<size_t>(i)], i);
  EXPECT_NE(threads.front(), std::this_thread::get_id());
  EXPECT_EQ(std::count(threads.begin(), threads.end(), threads.front()), 1000);
}

TEST_F(AsioWorkQueuesTest, NeverRunsTwoTasksOfAQueueAtOnceWhoeverHandsThemOver) {
  const auto queue = queues->makeQueue("com.example.one");
  std::atomic<int> inside{0};
  std::atomic<int> ran{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&queue, &inside, &ran] {
      for (int i = 0; i < 500; ++i) {
        queue->async([&inside, &ran] {
          EXPECT_EQ(inside.fetch_add(1), 0);
          ++ran;
          inside.fetch_sub(1);
        });
      }
    });
  }
  for (auto& thread : threads) thread.join();
  settle(*queue);
  EXPECT_EQ(ran.load(), 2000);
}

TEST_F(AsioWorkQueuesTest, DelayedTaskRunsAfterItsDelay) {
  const auto queue = queues->makeQueue("com.example.one");
  std::promise<Clock::time_point> ran;
  const auto before = Clock::now();
  queue->after(20ms, [&ran] { ran.set_value(Clock::now()); });
  auto at = ran.get_future();
  ASSERT_EQ(at.wait_for(test::kDeadline), std::future_status::ready);
  EXPECT_GE(at.get() - before, 20ms);
}

TEST_F(AsioWorkQueuesTest, TaskThatThrowsIsLoggedWithItsLabelAndTheQueueGoesOn) {
  const auto queue = queues->makeQueue("com.example.one");
  queue->async([] { throw std::runtime_error("no such luck"); });
  settle(*queue);
  EXPECT_TRUE(log.contains(LogLevel::error, "com.example.one: a task failed: no such luck"));
}

TEST_F(AsioWorkQueuesTest, NothingIsTakenBeforeTheFirstQueueAndAllGivenBackAtTheEnd) {
  queues.reset();
  const size_t before = descriptors();
  queues.emplace(log);
  EXPECT_EQ(descriptors(), before);
  auto queue = queues->makeQueue("com.example.one");
  EXPECT_GT(descriptors(), before);
  queue.reset();
  queues.reset();
  EXPECT_EQ(descriptors(), before);
}

TEST_F(AsioWorkQueuesTest, WhatStillWaitsAtTheEndIsDroppedUnrun) {
  auto queue = queues->makeQueue("com.example.one");
  const auto held = std::make_shared<int>(1);
  std::atomic<int> ran{0};
  // As a backend does: what a handler holds owns the source.
  struct Owner {
    std::shared_ptr<WorkQueue> queue;
    std::unique_ptr<EventSource> source;
    std::shared_ptr<int> held;
  };
  const auto [here, there] = socketPair();
  auto timed = std::make_shared<Owner>(Owner{queue, queue->makeTimer(1h, 0ms), held});
  auto reading = std::make_shared<Owner>(Owner{queue, queue->makeReadSource(here.get()), held});
  for (const auto& owner : {timed, reading}) {
    owner->source->start([owner, &ran] { ++ran; }, [owner, &ran] { ++ran; });
  }
  queue->after(1h, [held, &ran] { ++ran; });
  settle(*queue);
  queue.reset();
  timed.reset();
  reading.reset();
  EXPECT_GT(held.use_count(), 1);
  queues.reset();
  EXPECT_EQ(held.use_count(), 1);
  EXPECT_EQ(ran.load(), 0);
  EXPECT_EQ(::send(there.get(), "a", 1, 0), 1);  // the descriptor stayed open
}

TEST_F(AsioWorkQueuesTest, WithoutDescriptorsThereIsNoQueueAndALineSaysSo) {
#if defined(__SANITIZE_ADDRESS__)
  GTEST_SKIP() << "the sanitizers need descriptors of their own to look at an exception";
#endif
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  const rlimit none{3, before.rlim_max};  // only the standard streams
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  const auto queue = queues->makeQueue("com.example.one");
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
  EXPECT_EQ(queue, nullptr);
  EXPECT_EQ(log.startingWith("com.example.one: can't start the thread of the work queues: ").size(), 1U);
  EXPECT_NE(queues->makeQueue("com.example.one"), nullptr);  // as soon as there are some
}

TEST_F(AsioWorkQueuesTest, ThreadLeavesSignalsToOthers) {
  const auto queue = queues->makeQueue("com.example.one");
  sigset_t blocked;
  queue->async([&blocked] { pthread_sigmask(SIG_SETMASK, nullptr, &blocked); });
  settle(*queue);
  EXPECT_EQ(sigismember(&blocked, SIGTERM), 1);
  sigset_t here;
  pthread_sigmask(SIG_SETMASK, nullptr, &here);
  EXPECT_EQ(sigismember(&here, SIGTERM), 0);
}

}  // namespace
}  // namespace tarnel
