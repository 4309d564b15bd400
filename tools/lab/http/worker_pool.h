#pragma once

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace tarnel::lab {

// Threads made as they are needed, up to a limit. Threads: any.
class WorkerPool {
 public:
  explicit WorkerPool(size_t limit) : limit_(limit) {}
  ~WorkerPool() { stop(); }
  WorkerPool(const WorkerPool&) = delete;
  WorkerPool& operator=(const WorkerPool&) = delete;

  // Runs the job on a thread of its own; waits while all are busy. False, and the job is dropped, once
  // stopped.
  bool run(std::function<void()> job);
  // All threads are busy and at least one job waits for one.
  bool crowded() const;
  // Waits for the jobs that run; no job is taken afterwards. Jobs themselves must come to an end.
  void stop();

 private:
  void work();

  const size_t limit_;
  mutable std::mutex mutex_;
  std::condition_variable jobAdded_;
  std::condition_variable jobTaken_;
  std::deque<std::function<void()>> jobs_;
  std::vector<std::thread> threads_;
  size_t idle_ = 0;
  size_t waiting_ = 0;
  bool stopped_ = false;
};

}  // namespace tarnel::lab
