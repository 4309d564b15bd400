#include "platform/linux/system/transaction_keep_alive.h"

#include <utility>

namespace tarnel {

TransactionKeepAlive::TransactionKeepAlive(Options options) : options_(std::move(options)) {}

void TransactionKeepAlive::start() {
  if (openTransactions() == 0) armAgain();
}

void TransactionKeepAlive::armAgain() {
  if (options_.idleExit.count() == 0) return;
  uint64_t generation = 0;
  {
    const std::lock_guard guard(mutex_);
    generation = ++generation_;
  }
  options_.arm(options_.idleExit, generation);
}

void TransactionKeepAlive::beginTransaction() {
  const std::lock_guard guard(mutex_);
  ++open_;
  ++generation_;  // the delay that runs counts no more
}

void TransactionKeepAlive::endTransaction() {
  {
    const std::lock_guard guard(mutex_);
    if (open_ == 0 || --open_ != 0) return;
  }
  armAgain();
}

void TransactionKeepAlive::idleTimeElapsed(uint64_t generation) {
  {
    const std::lock_guard guard(mutex_);
    if (generation != generation_ || open_ != 0) return;
  }
  if (options_.isOtherWorkUnderWay && options_.isOtherWorkUnderWay()) {
    armAgain();
  } else {
    options_.idle();
  }
}

uint64_t TransactionKeepAlive::openTransactions() const {
  const std::lock_guard guard(mutex_);
  return open_;
}

}  // namespace tarnel
