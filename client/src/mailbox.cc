#include "client/src/mailbox.h"

#include <string>

namespace tarnel::core {
namespace {

// Bounds of one batch.
constexpr size_t kMaxBatchCalls = 64;
constexpr size_t kMaxBatchBytes = 256U << 10U;

Outcome closedOutcome() {
  return failure(TARNEL_ERROR_CLOSED, "the session is closed");
}

}  // namespace

Mailbox::Mailbox(UniqueFd wake, const Options& options)
    : wake_(std::move(wake)), maxCalls_(options.maxQueuedCalls), maxBytes_(options.maxQueuedBytes) {}

Outcome Mailbox::put(Request request) {
  bool wakes = false;
  {
    const std::lock_guard lock(mutex_);
    if (orders_.close) return closedOutcome();
    if (state_ != State::connecting && state_ != State::connected) return why_;
    // A barrier is what one waits with when the queue is full.
    const bool isLimited = request.kind != Request::Kind::barrier;
    if (isLimited && (waiting_.size() >= maxCalls_ || waitingBytes_ + request.bytes > maxBytes_)) {
      return failure(TARNEL_ERROR_QUEUE_FULL,
                     "queue full: " + std::to_string(waiting_.size()) + " calls with " +
                         std::to_string(waitingBytes_) + " bytes wait to be sent (limits " +
                         std::to_string(maxCalls_) + " and " + std::to_string(maxBytes_) +
                         "): wait for answers, send less, or raise max_queued_calls and max_queued_bytes");
    }
    waitingBytes_ += request.bytes;
    waiting_.push_back(std::move(request));
    wakes = std::exchange(wakesOnPut_, false);
  }
  if (wakes) wake();
  return {};
}

Outcome Mailbox::reconnect() {
  {
    const std::lock_guard lock(mutex_);
    if (orders_.close) return closedOutcome();
    if (state_ == State::connecting || state_ == State::connected) return {};
    state_ = State::connecting;
    orders_.connect = true;
  }
  wake();
  return {};
}

void Mailbox::close(SteadyTime closeBy) {
  {
    const std::lock_guard lock(mutex_);
    if (orders_.close) return;
    orders_.close = true;
    orders_.closeBy = closeBy;
  }
  wake();
}

State Mailbox::state() const {
  const std::lock_guard lock(mutex_);
  return orders_.close ? State::closed : state_;
}

void Mailbox::clearWake() {
  uint64_t count = 0;
  [[maybe_unused]] const ssize_t got = ::read(wake_.get(), &count, sizeof count);
}

Mailbox::Orders Mailbox::orders() {
  const std::lock_guard lock(mutex_);
  Orders orders = orders_;
  orders_.connect = false;
  return orders;
}

void Mailbox::setConnected() {
  const std::lock_guard lock(mutex_);
  state_ = State::connected;
}

std::deque<Request> Mailbox::setDisconnected(State state, const Outcome& why) {
  const std::lock_guard lock(mutex_);
  state_ = state;
  why_ = why;
  waitingBytes_ = 0;
  return std::exchange(waiting_, {});
}

std::vector<Request> Mailbox::take(size_t room) {
  const std::lock_guard lock(mutex_);
  std::vector<Request> taken;
  size_t bytes = 0;
  while (!waiting_.empty() && taken.size() < room && taken.size() < kMaxBatchCalls) {
    Request& next = waiting_.front();
    const bool isMessage = next.kind == Request::Kind::sendMessage;
    if (!taken.empty() && (!isMessage || bytes + next.bytes > kMaxBatchBytes)) break;
    bytes += next.bytes;
    taken.push_back(std::move(next));
    waiting_.pop_front();
    if (!isMessage) break;
  }
  waitingBytes_ -= bytes;
  return taken;
}

bool Mailbox::isEmpty() const {
  const std::lock_guard lock(mutex_);
  return waiting_.empty();
}

bool Mailbox::mayWait(bool canSend) {
  const std::lock_guard lock(mutex_);
  if (canSend && !waiting_.empty()) return false;
  wakesOnPut_ = canSend;
  return true;
}

void Mailbox::wake() const {
  const uint64_t one = 1;
  [[maybe_unused]] const ssize_t put = ::write(wake_.get(), &one, sizeof one);
}

}  // namespace tarnel::core
