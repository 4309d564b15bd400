#include "platform/linux/http/transfer_queue.h"

#include <gtest/gtest.h>

namespace tarnel::detail {
namespace {

TEST(TransferQueueTest, startsInOrderWhileThereIsRoom) {
  TransferQueue queue(2, 10);
  for (uint64_t id = 1; id <= 3; ++id) queue.add(id, "a");
  EXPECT_EQ(queue.next(), 1U);
  EXPECT_EQ(queue.next(), 2U);
  EXPECT_EQ(queue.next(), std::nullopt);
  queue.remove(1);
  EXPECT_EQ(queue.next(), 3U);
  EXPECT_EQ(queue.next(), std::nullopt);
}

TEST(TransferQueueTest, letsOtherHostsPassAHostThatIsFull) {
  TransferQueue queue(1, 10);
  queue.add(1, "a");
  queue.add(2, "a");
  queue.add(3, "b");
  EXPECT_EQ(queue.next(), 1U);
  EXPECT_EQ(queue.next(), 3U);
  EXPECT_EQ(queue.next(), std::nullopt);
  queue.remove(3);
  EXPECT_EQ(queue.next(), std::nullopt);
  queue.remove(1);
  EXPECT_EQ(queue.next(), 2U);
}

TEST(TransferQueueTest, boundsAllHostsTogetherAndTakesTheOldestFirst) {
  TransferQueue queue(2, 2);
  queue.add(1, "z");
  queue.add(2, "b");
  queue.add(3, "z");
  queue.add(4, "a");
  EXPECT_EQ(queue.next(), 1U);
  EXPECT_EQ(queue.next(), 2U);
  EXPECT_EQ(queue.next(), std::nullopt);
  queue.remove(2);
  EXPECT_EQ(queue.next(), 3U);
  queue.remove(1);
  EXPECT_EQ(queue.next(), 4U);
}

TEST(TransferQueueTest, forgetsWhatWaitsNoLonger) {
  TransferQueue queue(1, 10);
  for (uint64_t id = 1; id <= 3; ++id) queue.add(id, "a");
  EXPECT_EQ(queue.next(), 1U);
  queue.remove(2);
  queue.remove(99);
  queue.remove(1);
  EXPECT_EQ(queue.next(), 3U);
  queue.remove(3);
  queue.add(3, "b");
  EXPECT_EQ(queue.next(), 3U);
}

}  // namespace
}  // namespace tarnel::detail
