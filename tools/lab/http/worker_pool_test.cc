#include "tools/lab/http/worker_pool.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <latch>

namespace tarnel::lab {
namespace {

TEST(WorkerPoolTest, JobsRunSideBySideUpToTheLimit) {
  WorkerPool pool(3);
  std::latch together(3);
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(pool.run([&together] { together.arrive_and_wait(); }));
  }
  together.wait();
  pool.stop();
}

TEST(WorkerPoolTest, BeyondTheLimitAJobWaitsAndSaysSo) {
  WorkerPool pool(1);
  std::promise<void> go;
  std::atomic<int> done = 0;
  pool.run([&go, &done] {
    go.get_future().wait();
    ++done;
  });
  std::thread second([&pool, &done] { pool.run([&done] { ++done; }); });
  while (!pool.crowded()) std::this_thread::yield();
  EXPECT_EQ(done, 0);
  go.set_value();
  second.join();
  pool.stop();
  EXPECT_EQ(done, 2);
}

TEST(WorkerPoolTest, StoppingReleasesWhoWaits) {
  WorkerPool pool(1);
  std::promise<void> go;
  pool.run([&go] { go.get_future().wait(); });
  auto refused = std::async(std::launch::async, [&pool] { return pool.run([] {}); });
  while (!pool.crowded()) std::this_thread::yield();
  std::thread stopper([&pool] { pool.stop(); });
  EXPECT_FALSE(refused.get());
  go.set_value();
  stopper.join();
  EXPECT_FALSE(pool.run([] {}));
}

}  // namespace
}  // namespace tarnel::lab
