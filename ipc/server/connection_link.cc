#include "ipc/server/connection_link.h"

#include <sys/eventfd.h>

#include <system_error>
#include <utility>

#include "ipc/server/connection_loop.h"

namespace tarnel {

ConnectionLink::ConnectionLink(size_t maxQueuedBytes)
    : maxQueuedBytes_(maxQueuedBytes), wake_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  if (!wake_) throw std::system_error(errno, std::generic_category(), "eventfd");
}

ConnectionLink::Posted ConnectionLink::post(size_t bytes, Task task) {
  const bool fromOutside = loopOfThisThread() == nullptr;
  bool wasEmpty = false;
  {
    const std::lock_guard lock(mutex_);
    if (closed_) return Posted::closed;
    if (stopReason_) return Posted::full;
    wasEmpty = tasks_ == nullptr || tasks_->empty();
    if (wasEmpty || queuedBytes_ + bytes <= maxQueuedBytes_) {
      if (tasks_ == nullptr) tasks_ = std::make_unique<std::deque<Queued>>();
      tasks_->push_back({bytes, std::move(task)});
      queuedBytes_ += bytes;
    } else {
      stopReason_ = "the client does not read: the limit of " + std::to_string(maxQueuedBytes_) +
                    " queued bytes is reached";
    }
    if (stopReason_) {
      wake();
      return Posted::full;
    }
  }
  if (wasEmpty && fromOutside) wake();
  return Posted::queued;
}

void ConnectionLink::stop(std::string reason) {
  const std::lock_guard lock(mutex_);
  if (closed_ || stopReason_) return;
  stopReason_ = std::move(reason);
  wake();
}

bool ConnectionLink::closed() const {
  const std::lock_guard lock(mutex_);
  return closed_ || stopReason_.has_value();
}

ConnectionLoop* ConnectionLink::loopOfThisThread() const noexcept {
  return owner_.load(std::memory_order_relaxed) == std::this_thread::get_id() ? loop_ : nullptr;
}

void ConnectionLink::bind(ConnectionLoop& loop) {
  loop_ = &loop;
  owner_.store(std::this_thread::get_id(), std::memory_order_relaxed);
}

void ConnectionLink::wake() const {
  // Cannot fail: the counter would have to reach 2^64 - 1.
  eventfd_write(wake_.get(), 1);
}

void ConnectionLink::drainWake() const {
  eventfd_t count = 0;
  eventfd_read(wake_.get(), &count);
}

ConnectionLink::Task ConnectionLink::takeTask() {
  const std::lock_guard lock(mutex_);
  if (tasks_ == nullptr) return nullptr;
  if (tasks_->empty()) {
    tasks_.reset();
    return nullptr;
  }
  Queued next = std::move(tasks_->front());
  tasks_->pop_front();
  queuedBytes_ -= next.bytes;
  return std::move(next.task);
}

std::optional<std::string> ConnectionLink::stopReason() const {
  const std::lock_guard lock(mutex_);
  return stopReason_;
}

void ConnectionLink::close() {
  // Let go outside the lock: what the tasks hold may come back here from its destructor.
  std::unique_ptr<std::deque<Queued>> dropped;
  const std::lock_guard lock(mutex_);
  closed_ = true;
  queuedBytes_ = 0;
  owner_.store({}, std::memory_order_relaxed);
  loop_ = nullptr;
  dropped = std::move(tasks_);
}

CallToken::~CallToken() {
  if (link_ == nullptr) return;
  if (auto* loop = link_->loopOfThisThread()) {
    loop->abandon(serial_);
    return;
  }
  link_->post(kSmallAnswer, [serial = serial_](ConnectionLoop& loop) { loop.abandon(serial); });
}

}  // namespace tarnel
