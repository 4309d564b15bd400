#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <utility>

namespace tarnel::detail {

// Requests by the time at which each is due. Threads: one.
class DueTimes {
 public:
  using Time = std::chrono::steady_clock::time_point;

  // Replaces the time that the request had.
  void set(uint64_t id, Time time) {
    remove(id);
    times_.emplace(id, time);
    order_.emplace(time, id);
  }
  void remove(uint64_t id) {
    const auto found = times_.find(id);
    if (found == times_.end()) return;
    order_.erase({found->second, id});
    times_.erase(found);
  }
  // The one that has been due for longest.
  std::optional<uint64_t> due(Time now) const {
    if (order_.empty() || order_.begin()->first > now) return std::nullopt;
    return order_.begin()->second;
  }
  std::optional<Time> next() const {
    return order_.empty() ? std::nullopt : std::optional(order_.begin()->first);
  }

 private:
  std::map<uint64_t, Time> times_;
  std::set<std::pair<Time, uint64_t>> order_;
};

}  // namespace tarnel::detail
