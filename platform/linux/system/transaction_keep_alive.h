#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <mutex>

#include "platform/keep_alive.h"

namespace tarnel {

// Counts the open transactions and says when the process has been idle long enough to end itself.
//
// The timer is the caller's: `arm` is asked to call idleTimeElapsed(generation) once after the delay, and a
// later arm() replaces an earlier one. A generation that is no longer current is ignored, so that a late
// timer does no harm.
//
// Threads: any. `arm` and `idle` run on the thread that caused them, without a lock held.
class TransactionKeepAlive final : public KeepAlive {
 public:
  using Arm = std::function<void(std::chrono::seconds delay, uint64_t generation)>;

  // `idleExit` 0: never idle; `arm` and `idle` are then not called. `idle` runs when no transaction was open
  // for the whole delay and no other work is under way; with other
  // work the delay begins anew.
  struct Options {
    std::chrono::seconds idleExit{0};
    Arm arm;
    std::function<bool()> isOtherWorkUnderWay;  // such as a post that has not ended; may be empty
    std::function<void()> idle;
  };

  explicit TransactionKeepAlive(Options options);

  // Begins the first delay, for a process that nobody connects to.
  void start();

  void beginTransaction() override;
  // Without a transaction it does nothing.
  void endTransaction() override;

  void idleTimeElapsed(uint64_t generation);

  uint64_t openTransactions() const;

 private:
  void armAgain();

  const Options options_;
  mutable std::mutex mutex_;
  uint64_t open_ = 0;        // guarded by mutex_
  uint64_t generation_ = 0;  // guarded by mutex_; of the delay that counts
};

}  // namespace tarnel
