#include "tools/lab/print_queue.h"

namespace tarnel::lab {

PrintQueue::PrintQueue(std::function<Text(uint64_t)> lossText, size_t maxWaitingBytes)
    : lossText_(std::move(lossText)), maxWaitingBytes_(maxWaitingBytes), thread_([this] { run(); }) {}

PrintQueue::~PrintQueue() {
  {
    const std::lock_guard lock(mutex_);
    ending_ = true;
  }
  changed_.notify_all();
  thread_.join();
}

void PrintQueue::print(Text text) {
  {
    const std::lock_guard lock(mutex_);
    if (!waiting_.empty() && waitingBytes_ + text.bytes.size() > maxWaitingBytes_) {
      ++lost_;
      return;
    }
    appendLoss();
    append(std::move(text));
  }
  changed_.notify_all();
}

void PrintQueue::flush() {
  std::unique_lock lock(mutex_);
  changed_.wait(lock, [this] { return waiting_.empty() && lost_ == 0 && !printing_; });
}

void PrintQueue::append(Text text) {
  waitingBytes_ += text.bytes.size();
  waiting_.push_back(std::move(text));
}

void PrintQueue::appendLoss() {
  if (lost_ == 0) return;
  append(lossText_(lost_));
  lost_ = 0;
}

void PrintQueue::run() {
  std::unique_lock lock(mutex_);
  for (;;) {
    changed_.wait(lock, [this] { return !waiting_.empty() || lost_ > 0 || ending_; });
    if (waiting_.empty()) appendLoss();
    if (waiting_.empty()) return;
    const Text text = std::move(waiting_.front());
    waiting_.pop_front();
    waitingBytes_ -= text.bytes.size();
    printing_ = true;
    lock.unlock();
    std::fwrite(text.bytes.data(), 1, text.bytes.size(), text.stream);
    std::fflush(text.stream);
    lock.lock();
    printing_ = false;
    changed_.notify_all();
  }
}

}  // namespace tarnel::lab
