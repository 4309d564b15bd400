#include "platform/linux/queues/asio_work_queues_test_support.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <future>
#include <stdexcept>
#include <vector>

// Timers and readable descriptors of the queues.

namespace tarnel {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

TEST_F(AsioWorkQueuesTest, TimerTicksFromOnePeriodOnUntilItIsCancelledByItsOwnHandler) {
  const auto queue = queues->makeQueue("com.example.one");
  auto timer = queue->makeTimer(10ms, 2ms);
  ASSERT_NE(timer, nullptr);
  std::vector<Clock::time_point> ticks;
  std::promise<void> cancelled;
  const auto start = Clock::now();
  timer->start(
      [&ticks, &timer] {
        ticks.push_back(Clock::now());
        if (ticks.size() == 4) timer->cancel();
      },
      [&cancelled] { cancelled.set_value(); });
  expectSoon(cancelled.get_future());
  settle(*queue);
  ASSERT_EQ(ticks.size(), 4U);
  EXPECT_GE(ticks[0] - start, 10ms);
  EXPECT_GE(ticks[3] - start, 40ms);
  EXPECT_EQ(queues->sourcesUnderWay(), 0U);
}

TEST_F(AsioWorkQueuesTest, TicksThatWereMissedAreOne) {
  const auto queue = queues->makeQueue("com.example.one");
  auto timer = queue->makeTimer(40ms, 0ms);
  std::vector<Clock::time_point> ticks;
  std::promise<void> over;
  timer->start(
      [&ticks, &timer] {
        ticks.push_back(Clock::now());
        // Holds the queue for five periods.
        const test::Deadline deadline(200ms);
        while (ticks.size() == 1 && !deadline.passed()) std::this_thread::yield();
        if (ticks.size() == 4) timer->cancel();
      },
      [&over] { over.set_value(); });
  expectSoon(over.get_future());
  ASSERT_EQ(ticks.size(), 4U);
  EXPECT_GE(ticks[1] - ticks[0], 200ms);
  // Made up for one after the other they would come at once.
  EXPECT_GE(ticks[3] - ticks[1], 20ms);
}

TEST_F(AsioWorkQueuesTest, LeewayIsHeldToHalfAPeriod) {
  const auto queue = queues->makeQueue("com.example.one");
  auto timer = queue->makeTimer(4ms, 10min);  // would be due in minutes
  std::promise<void> ticked;
  timer->start(
      [&ticked, &timer] {
        timer->cancel();
        ticked.set_value();
      },
      nullptr);
  expectSoon(ticked.get_future());
  settle(*queue);
}

TEST_F(AsioWorkQueuesTest, TimersWithTheSameLeewayTickOnCommonMarks) {
  const auto queue = queues->makeQueue("com.example.one");
  constexpr auto kLeeway = 20ms;
  const auto nextMark = [](Clock::time_point time) {
    return Clock::time_point(
        std::chrono::ceil<std::chrono::duration<int64_t, std::ratio<20, 1000>>>(time.time_since_epoch()));
  };
  for (int i = 0; i < 6; ++i) {
    auto timer = queue->makeTimer(2 * kLeeway, kLeeway);
    std::promise<Clock::time_point> ticked;
    const auto earliest = nextMark(Clock::now() + 2 * kLeeway);
    timer->start(
        [&ticked, &timer] {
          timer->cancel();
          ticked.set_value(Clock::now());
        },
        nullptr);
    auto tick = ticked.get_future();
    ASSERT_EQ(tick.wait_for(test::kDeadline), std::future_status::ready);
    EXPECT_GE(tick.get(), earliest);
    settle(*queue);
    const test::Deadline elsewhere(std::chrono::milliseconds(3 + i));  // the next begins off the mark
    while (!elsewhere.passed()) std::this_thread::yield();
  }
}

TEST_F(AsioWorkQueuesTest, TimerWithoutAPeriodIsRefused) {
  EXPECT_EQ(queues->makeQueue("com.example.one")->makeTimer(0ms, 0ms), nullptr);
}

TEST_F(AsioWorkQueuesTest, ReadSourceFiresForWhatWasThereBeforeAndForWhatComes) {
  const auto queue = queues->makeQueue("com.example.one");
  const auto [here, there] = socketPair();
  ASSERT_EQ(::send(there.get(), "a", 1, 0), 1);
  ASSERT_EQ(::send(there.get(), "b", 1, 0), 1);
  auto source = queue->makeReadSource(here.get());
  ASSERT_NE(source, nullptr);
  std::string got;
  std::promise<void> two;
  std::promise<void> three;
  std::promise<void> gone;
  source->start(
      [&got, &two, &three, fd = here.get()] {
        char c = 0;
        if (::recv(fd, &c, 1, MSG_DONTWAIT) == 1) got += c;  // one for each event
        if (got.size() == 2) two.set_value();
        if (got.size() == 3) three.set_value();
      },
      [&gone] { gone.set_value(); });
  expectSoon(two.get_future());
  ASSERT_EQ(::send(there.get(), "c", 1, 0), 1);
  expectSoon(three.get_future());
  source.reset();
  expectSoon(gone.get_future());  // only then may the descriptor be closed
  EXPECT_EQ(got, "abc");
}

TEST_F(AsioWorkQueuesTest, CancelHandlerMayCloseTheDescriptorAndRunsOnce) {
  const auto queue = queues->makeQueue("com.example.one");
  auto [here, there] = socketPair();
  auto source = queue->makeReadSource(here.get());
  std::atomic<int> events{0};
  std::atomic<int> cancels{0};
  source->start([&events] { ++events; },
                [&cancels, fd = &here] {
                  ++cancels;
                  fd->reset();
                });
  settle(*queue);
  source->cancel();
  source->cancel();
  source.reset();
  settle(*queue);
  settle(*queue);  // the wait's own end comes after the cancellation
  EXPECT_EQ(cancels.load(), 1);
  EXPECT_EQ(events.load(), 0);
  EXPECT_FALSE(static_cast<bool>(here));
  EXPECT_EQ(queues->sourcesUnderWay(), 0U);
}

TEST_F(AsioWorkQueuesTest, EventThatHasHappenedIsNotHandledOnceItsSourceIsCancelledOnTheQueue) {
  const auto queue = queues->makeQueue("com.example.one");
  auto one = queue->makeTimer(5ms, 0ms);
  auto other = queue->makeTimer(5ms, 0ms);
  std::atomic<int> events{0};
  const auto tick = [&] {
    ++events;
    one->cancel();
    other->cancel();
  };
  std::promise<void> both;
  std::atomic<int> cancelled{0};
  const auto end = [&both, &cancelled] {
    if (++cancelled == 2) both.set_value();
  };
  one->start(tick, end);
  other->start(tick, end);
  queue->async([] {  // until both are overdue, and their events come in one go
    const test::Deadline deadline(30ms);
    while (!deadline.passed()) std::this_thread::yield();
  });
  expectSoon(both.get_future());
  settle(*queue);
  EXPECT_EQ(events.load(), 1);
  EXPECT_EQ(cancelled.load(), 2);
}

TEST_F(AsioWorkQueuesTest, SourceThatIsCancelledBeforeItsStartOnlyEnds) {
  const auto queue = queues->makeQueue("com.example.one");
  const auto pair = socketPair();
  auto source = queue->makeReadSource(pair.first.get());  // on which nothing ever happens
  source->cancel();
  std::promise<void> cancelled;
  source->start([] { ADD_FAILURE() << "an event after the end"; }, [&cancelled] { cancelled.set_value(); });
  expectSoon(cancelled.get_future());
  settle(*queue);
  EXPECT_EQ(queues->sourcesUnderWay(), 0U);
}

TEST_F(AsioWorkQueuesTest, CancelHandlerMayCloseTheDescriptorForANewOneOfItsNumber) {
  const auto queue = queues->makeQueue("com.example.one");
  auto pair = socketPair();
  const int number = pair.first.get();
  auto source = queue->makeReadSource(number);
  ASSERT_NE(source, nullptr);
  std::pair<UniqueFd, UniqueFd> newPair;
  std::unique_ptr<EventSource> newSource;
  std::promise<void> isReadable;
  std::promise<void> replaced;
  source->start([] {},
                [&] {
                  auto made = socketPair();
                  pair.first.reset();
                  EXPECT_EQ(::dup2(made.first.get(), number), number);
                  newPair = {UniqueFd(number), std::move(made.second)};
                  newSource = queue->makeReadSource(number);
                  ASSERT_NE(newSource, nullptr);
                  newSource->start(
                      [&isReadable, &newSource] {
                        newSource->cancel();
                        isReadable.set_value();
                      },
                      nullptr);
                  replaced.set_value();
                });
  source->cancel();
  expectSoon(replaced.get_future());
  settle(*queue);
  source.reset();  // what is left of it must not take the number for its own
  settle(*queue);
  EXPECT_EQ(::send(newPair.second.get(), "x", 1, 0), 1);
  expectSoon(isReadable.get_future());
  settle(*queue);
}

TEST_F(AsioWorkQueuesTest, SourceThatIsLetGoLetsGoOfWhatItsHandlersHold) {
  const auto queue = queues->makeQueue("com.example.one");
  const auto held = std::make_shared<int>(1);
  std::promise<void> cancelled;
  auto timer = queue->makeTimer(1h, 0ms);
  timer->start([held] {}, [held, &cancelled] { cancelled.set_value(); });
  EXPECT_EQ(held.use_count(), 3);
  EXPECT_EQ(queues->sourcesUnderWay(), 1U);
  timer.reset();
  expectSoon(cancelled.get_future());
  settle(*queue);
  EXPECT_EQ(held.use_count(), 1);
  EXPECT_EQ(queues->sourcesUnderWay(), 0U);
}

TEST_F(AsioWorkQueuesTest, SourceThatNeverStartedGoesSilently) {
  const auto queue = queues->makeQueue("com.example.one");
  const auto [here, there] = socketPair();
  queue->makeReadSource(here.get());
  queue->makeTimer(1ms, 0ms);
  settle(*queue);
  EXPECT_EQ(::send(there.get(), "a", 1, 0), 1);  // the descriptor stayed open
}

TEST_F(AsioWorkQueuesTest, DescriptorThatCannotBeWaitedForIsRefused) {
  EXPECT_EQ(queues->makeQueue("com.example.one")->makeReadSource(-1), nullptr);
}

TEST_F(AsioWorkQueuesTest, TimerWhoseHandlerThrowsTicksOn) {
  const auto queue = queues->makeQueue("com.example.one");
  auto timer = queue->makeTimer(1ms, 0ms);
  std::promise<void> over;
  int ticks = 0;
  timer->start(
      [&ticks, &timer] {
        if (++ticks == 2) timer->cancel();
        throw std::runtime_error("again");
      },
      [&over] { over.set_value(); });
  expectSoon(over.get_future());
  EXPECT_EQ(log.count(LogLevel::error, "com.example.one: a task failed: again"), 2U);
}

}  // namespace
}  // namespace tarnel
