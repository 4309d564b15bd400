#include "platform/linux/heap_memory.h"

#include <gtest/gtest.h>

#include <barrier>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

namespace tarnel {
namespace {

constexpr size_t kMiB = size_t{1} << 20U;

// Memory that this process holds, without what comes from files.
size_t residentBytes() {
  std::ifstream status("/proc/self/status");
  for (std::string line; std::getline(status, line);) {
    if (line.starts_with("RssAnon:")) return std::stoul(line.substr(8)) * 1024;
  }
  return 0;
}

TEST(HeapMemoryTest, LargeBlocksGoBackWhicheverThreadHadThem) {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
  GTEST_SKIP() << "a sanitizer keeps memory that was freed";
#endif
  constexpr int kThreads = 8;
  returnLargeBlocks();
  const size_t before = residentBytes();
  std::barrier<> done(kThreads + 1);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&done] {
      for (int round = 0; round < 3; ++round) {
        const std::string contents(3 * kMiB, 'x');
        const std::string compressed(3 * kMiB, 'y');
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

}  // namespace
}  // namespace tarnel
