#include "platform/linux/system/system_clock.h"

#include <ctime>

namespace tarnel {

TimeValue SystemClock::timeOfDay() {
  std::timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  return {now.tv_sec, static_cast<int32_t>(now.tv_nsec / 1000)};
}

}  // namespace tarnel
