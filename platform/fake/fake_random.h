#pragma once

#include <mutex>

#include "platform/random.h"

namespace tarnel::fake {

// Gives the number it was told, and UUIDs that count up. Threads: any.
class FakeRandom final : public Random {
 public:
  double uniform() override {
    const std::lock_guard guard(mutex_);
    return next_;
  }
  UuidBytes uuid() override {
    const std::lock_guard guard(mutex_);
    UuidBytes bytes{};
    ++count_;
    bytes[14] = static_cast<uint8_t>(count_ >> 8U);
    bytes[15] = static_cast<uint8_t>(count_);
    return bytes;
  }
  void setUniform(double value) {
    const std::lock_guard guard(mutex_);
    next_ = value;
  }

 private:
  std::mutex mutex_;
  double next_ = 0.5;
  unsigned count_ = 0;
};

}  // namespace tarnel::fake
