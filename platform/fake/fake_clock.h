#pragma once

#include <cmath>
#include <mutex>

#include "platform/clock.h"

namespace tarnel::fake {

// Stands still until told otherwise. Threads: any.
class FakeClock final : public Clock {
 public:
  TimeValue timeOfDay() override {
    const std::lock_guard guard(mutex_);
    return now_;
  }
  void set(TimeValue now) {
    const std::lock_guard guard(mutex_);
    now_ = now;
  }
  // Negative: the clock is set back.
  void advance(double seconds) {
    const std::lock_guard guard(mutex_);
    const auto micros = now_.seconds * 1000000 + now_.microseconds + std::llround(seconds * 1000000.0);
    now_ = {micros / 1000000, static_cast<int32_t>(micros % 1000000)};
  }

 private:
  std::mutex mutex_;
  TimeValue now_{1700000000, 0};
};

}  // namespace tarnel::fake
