#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <array>
#include <future>
#include <optional>
#include <utility>

#include "base/unique_fd.h"
#include "platform/fake/fake_log.h"
#include "platform/linux/queues/asio_work_queues.h"
#include "testing/waiting.h"

namespace tarnel {

inline std::pair<UniqueFd, UniqueFd> socketPair() {
  std::array<int, 2> ends{};
  EXPECT_EQ(::socketpair(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0, ends.data()), 0);
  return {UniqueFd(ends[0]), UniqueFd(ends[1])};
}

// Work queues on a thread of their own.
class AsioWorkQueuesTest : public ::testing::Test {
 protected:
  // Returns once everything that was handed over before has run.
  static void settle(WorkQueue& queue) {
    std::promise<void> done;
    queue.async([&done] { done.set_value(); });
    ASSERT_EQ(done.get_future().wait_for(test::kDeadline), std::future_status::ready);
  }
  static void expectSoon(const std::future<void>& future) {
    EXPECT_EQ(future.wait_for(test::kDeadline), std::future_status::ready);
  }

  fake::FakeLog log;
  std::optional<AsioWorkQueues> queues{std::in_place, log};
};

}  // namespace tarnel
