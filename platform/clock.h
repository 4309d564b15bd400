#pragma once

#include "base/types.h"

namespace tarnel {

// The wall clock. Threads: any.
class Clock {
 public:
  Clock() = default;
  Clock(const Clock&) = delete;
  Clock& operator=(const Clock&) = delete;
  virtual ~Clock() = default;
  virtual TimeValue timeOfDay() = 0;
};

}  // namespace tarnel
