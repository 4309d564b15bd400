#pragma once

#include "platform/random.h"

namespace tarnel {

// Random bits of the kernel. Threads: any.
class SystemRandom final : public Random {
 public:
  double uniform() override;
  UuidBytes uuid() override;
};

}  // namespace tarnel
