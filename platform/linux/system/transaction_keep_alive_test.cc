#include "platform/linux/system/transaction_keep_alive.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

namespace tarnel {
namespace {

class TransactionKeepAliveTest : public testing::Test {
 protected:
  TransactionKeepAlive make(int64_t seconds) {
    return TransactionKeepAlive({.idleExit = std::chrono::seconds(seconds),
                                 .arm =
                                     [this](std::chrono::seconds delay, uint64_t generation) {
                                       EXPECT_EQ(delay, std::chrono::seconds(30));
                                       armed_.push_back(generation);
                                     },
                                 .isOtherWorkUnderWay = [this] { return working_; },
                                 .idle = [this] { ++idle_; }});
  }

  std::vector<uint64_t> armed_;
  bool working_ = false;
  int idle_ = 0;
};

TEST_F(TransactionKeepAliveTest, EndsWhenNothingWasOpenForTheWholeDelay) {
  auto keepAlive = make(30);
  keepAlive.start();
  ASSERT_EQ(armed_.size(), 1U);
  keepAlive.idleTimeElapsed(armed_[0]);
  EXPECT_EQ(idle_, 1);
}

TEST_F(TransactionKeepAliveTest, AnOpenTransactionKeepsTheProcess) {
  auto keepAlive = make(30);
  keepAlive.start();
  keepAlive.beginTransaction();
  keepAlive.idleTimeElapsed(armed_[0]);
  EXPECT_EQ(idle_, 0);
  keepAlive.beginTransaction();
  keepAlive.endTransaction();
  EXPECT_EQ(armed_.size(), 1U);
  keepAlive.endTransaction();
  ASSERT_EQ(armed_.size(), 2U);
  // The timer of the first delay may come late.
  keepAlive.idleTimeElapsed(armed_[0]);
  EXPECT_EQ(idle_, 0);
  keepAlive.idleTimeElapsed(armed_[1]);
  EXPECT_EQ(idle_, 1);
}

TEST_F(TransactionKeepAliveTest, OtherWorkBeginsTheDelayAnew) {
  auto keepAlive = make(30);
  keepAlive.start();
  working_ = true;
  keepAlive.idleTimeElapsed(armed_[0]);
  EXPECT_EQ(idle_, 0);
  ASSERT_EQ(armed_.size(), 2U);
  working_ = false;
  keepAlive.idleTimeElapsed(armed_[1]);
  EXPECT_EQ(idle_, 1);
}

TEST_F(TransactionKeepAliveTest, SwitchedOffItOnlyCounts) {
  auto keepAlive = make(0);
  keepAlive.start();
  keepAlive.beginTransaction();
  EXPECT_EQ(keepAlive.openTransactions(), 1U);
  keepAlive.endTransaction();
  EXPECT_TRUE(armed_.empty());
}

TEST_F(TransactionKeepAliveTest, AnEndWithoutABeginIsIgnored) {
  auto keepAlive = make(30);
  keepAlive.endTransaction();
  EXPECT_EQ(keepAlive.openTransactions(), 0U);
  EXPECT_TRUE(armed_.empty());
}

TEST_F(TransactionKeepAliveTest, ManyThreadsMayBeginAndEnd) {
  auto keepAlive = make(0);
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&keepAlive] {
      for (int round = 0; round < 1000; ++round) {
        keepAlive.beginTransaction();
        keepAlive.endTransaction();
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(keepAlive.openTransactions(), 0U);
}

}  // namespace
}  // namespace tarnel
