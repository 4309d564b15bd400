#include "platform/linux/system/heap_memory.h"

#include <gtest/gtest.h>
#include <sys/resource.h>

#include <barrier>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

namespace tarnel {
namespace {

constexpr size_t kMiB = size_t{1} << 20U;

class HeapMemoryTest : public ::testing::Test {
 protected:
  void SetUp() override {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "a sanitizer keeps memory that was freed";
#endif
    ASSERT_TRUE(returnLargeBlocks());
  }

  // Memory that this process holds, without what comes from files.
  static size_t residentBytes() {
    std::ifstream status("/proc/self/status");
    for (std::string line; std::getline(status, line);) {
      if (line.starts_with("RssAnon:")) return std::stoul(line.substr(8)) * 1024;
    }
    return 0;
  }
  static long faultsOfThisThread() {
    rusage usage{};
    EXPECT_EQ(::getrusage(RUSAGE_THREAD, &usage), 0);
    return usage.ru_minflt;
  }
};

TEST_F(HeapMemoryTest, LargeBlocksGoBackWhicheverThreadHadThem) {
  constexpr int kThreads = 8;
  const size_t before = residentBytes();
  std::barrier<> done(kThreads + 1);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&done] {
      for (int round = 0; round < 3; ++round) {
        const std::string contents(kLargeBlockBytes, 'x');
        const std::string compressed(kLargeBlockBytes, 'y');
        EXPECT_NE(contents, compressed);
      }
      done.arrive_and_wait();  // it has freed all, and lives
      done.arrive_and_wait();
    });
  }
  done.arrive_and_wait();
  EXPECT_LT(residentBytes(), before + 4 * kMiB);
  done.arrive_and_wait();
  for (auto& thread : threads) thread.join();
}

TEST_F(HeapMemoryTest, TheLargestFilesGoBackToo) {
  const size_t before = residentBytes();
  for (int round = 0; round < 3; ++round) {
    const std::string contents(32 * kMiB, 'x');
    EXPECT_GE(residentBytes(), before + 31 * kMiB);
  }
  EXPECT_LT(residentBytes(), before + 4 * kMiB);
}

// What every post needs anew is not asked of the system anew.
TEST_F(HeapMemoryTest, WhatIsSmallerIsKeptForTheNext) {
  std::thread([] {
    const auto post = [] {
      for (const size_t bytes : {200'000, 400'000, 800'000, 1'600'000, 3'200'000}) {
        const std::string body(bytes, 'x');
        EXPECT_EQ(body.back(), 'x');
      }
    };
    post();
    const long before = faultsOfThisThread();
    for (int i = 0; i < 20; ++i) post();
    EXPECT_LT(faultsOfThisThread() - before, 100);
  }).join();
}

}  // namespace
}  // namespace tarnel
