#include "tools/lab/http/worker_pool.h"

namespace tarnel::lab {

bool WorkerPool::run(std::function<void()> job) {
  std::unique_lock lock(mutex_);
  ++waiting_;
  jobTaken_.wait(lock, [this] { return stopped_ || jobs_.size() < idle_ || threads_.size() < limit_; });
  --waiting_;
  if (stopped_) return false;
  const bool threadNeeded = jobs_.size() >= idle_;
  jobs_.push_back(std::move(job));
  if (threadNeeded) threads_.emplace_back([this] { work(); });
  jobAdded_.notify_one();
  return true;
}

bool WorkerPool::crowded() const {
  const std::lock_guard lock(mutex_);
  return waiting_ > 0;
}

void WorkerPool::work() {
  std::unique_lock lock(mutex_);
  for (;;) {
    ++idle_;
    jobTaken_.notify_one();
    jobAdded_.wait(lock, [this] { return stopped_ || !jobs_.empty(); });
    --idle_;
    if (jobs_.empty()) return;
    std::function<void()> job = std::move(jobs_.front());
    jobs_.pop_front();
    lock.unlock();
    job();
    job = nullptr;
    lock.lock();
  }
}

void WorkerPool::stop() {
  std::vector<std::thread> threads;
  {
    const std::lock_guard lock(mutex_);
    stopped_ = true;
    threads.swap(threads_);
  }
  jobAdded_.notify_all();
  jobTaken_.notify_all();
  for (std::thread& thread : threads) thread.join();
}

}  // namespace tarnel::lab
