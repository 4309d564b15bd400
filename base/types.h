#pragma once

#include <cstdint>

// Numbers of the message road that must never be mixed up.

namespace tarnel {

// A message's method: the category that its client gave.
enum class Method : uint16_t {};
// A message's status: the type that its client gave.
enum class RespCode : uint16_t {};
// A backend's running event number; its first event carries 1.
enum class EventID : uint16_t {};
// Delivery flag, a bit set: bit 0 real-time, bit 1 important (3 is both).
enum class Flag : int32_t { normal = 0, realtime = 1, important = 2 };

constexpr bool isRealtime(Flag flag) noexcept {
  return static_cast<int32_t>(flag) == 1 || static_cast<int32_t>(flag) == 3;
}
constexpr bool isImportant(Flag flag) noexcept {
  return static_cast<int32_t>(flag) == 2 || static_cast<int32_t>(flag) == 3;
}

// Reporting state of a backend.
enum class ReportingState : int32_t {
  undecided = 0,
  disabled = 1,
  enabled = 2,
  sampledOut = 3,  // events are held; an important message turns it into enabled
};

// Wall-clock time of day as the system call fills it: seconds since 1970 and microseconds (0 to 999,999).
struct TimeValue {
  int64_t seconds = 0;
  int32_t microseconds = 0;
  friend bool operator==(const TimeValue&, const TimeValue&) = default;
};

constexpr double secondsFromTimeValue(const TimeValue& time) noexcept {
  return static_cast<double>(time.seconds) + static_cast<double>(time.microseconds) / 1000000.0;
}

}  // namespace tarnel
