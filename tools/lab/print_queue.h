#pragma once

#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <thread>

namespace tarnel::lab {

// Prints texts in their order on a thread of its own: who prints never waits for a terminal that was stopped
// or for a program that does not read. Threads: any.
class PrintQueue {
 public:
  // Texts that wait come to so many bytes at most; those beyond are lost, and counted.
  static constexpr size_t kMaxWaitingBytes = 16U << 20U;

  struct Text {
    std::FILE* stream = nullptr;  // outlives the queue
    std::string bytes;
  };

  // lossText: what is printed in the place of so many lost texts.
  explicit PrintQueue(std::function<Text(uint64_t lost)> lossText, size_t maxWaitingBytes = kMaxWaitingBytes);
  PrintQueue(const PrintQueue&) = delete;
  PrintQueue& operator=(const PrintQueue&) = delete;
  // Returns when all has been printed.
  ~PrintQueue();

  void print(Text text);
  // Returns when all that was given before has been printed.
  void flush();

 private:
  void run();
  // Both with mutex_ held.
  void append(Text text);
  void appendLoss();

  const std::function<Text(uint64_t)> lossText_;
  const size_t maxWaitingBytes_;
  std::mutex mutex_;
  std::condition_variable changed_;
  std::deque<Text> waiting_;
  size_t waitingBytes_ = 0;
  uint64_t lost_ = 0;
  bool printing_ = false;
  bool ending_ = false;
  std::thread thread_;
};

}  // namespace tarnel::lab
