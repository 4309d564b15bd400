#pragma once

#include <array>
#include <cstdint>
#include <string>

namespace tarnel {

using UuidBytes = std::array<uint8_t, 16>;

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

// Canonical 36-character text, upper case: "8-4-4-4-12" hexadecimal digits (RFC 4122 section 3).
std::string uuidText(const UuidBytes& uuid);

}  // namespace tarnel
