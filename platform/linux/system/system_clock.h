#pragma once

#include "platform/clock.h"

namespace tarnel {

// The system's real-time clock. Threads: any.
class SystemClock final : public Clock {
 public:
  TimeValue timeOfDay() override;
};

}  // namespace tarnel
