#pragma once

#include "base/uuid.h"

namespace tarnel {

// Threads: any.
class Random {
 public:
  Random() = default;
  Random(const Random&) = delete;
  Random& operator=(const Random&) = delete;
  virtual ~Random() = default;

  // Uniform in [0, 1), with 48 random bits.
  virtual double uniform() = 0;
  // A random UUID (RFC 4122 version 4).
  virtual UuidBytes uuid() = 0;
};

}  // namespace tarnel
