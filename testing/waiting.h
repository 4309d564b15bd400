#pragma once

#include <chrono>

namespace tarnel::test {

// How long anything that must happen may take, on a machine with much else to do.
inline constexpr std::chrono::seconds kDeadline{30};

// Counts down from its making.
class Deadline {
 public:
  explicit Deadline(std::chrono::milliseconds time = kDeadline)
      : end_(std::chrono::steady_clock::now() + time) {}

  bool passed() const { return std::chrono::steady_clock::now() >= end_; }
  std::chrono::steady_clock::time_point end() const { return end_; }
  // For poll: at least 0.
  int milliseconds() const {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(end_ - std::chrono::steady_clock::now());
    return left.count() < 0 ? 0 : static_cast<int>(left.count());
  }

 private:
  std::chrono::steady_clock::time_point end_;
};

}  // namespace tarnel::test
