#pragma once

#include <cstddef>
#include <deque>

#include "platform/base/value.h"

namespace tarnel {

// Events that wait for a flush, in order of arrival. What waits is bounded, since a client may keep its
// backend from ever flushing.
//
// Threads: one at a time.
class EventBatch {
 public:
  static constexpr size_t kMaxEvents = 10000;
  static constexpr size_t kMaxBytes = 4U << 20U;  // as estimateSize counts

  // Memory that the event holds, roughly, in bytes.
  static size_t estimateSize(const Dictionary& event);

  size_t size() const noexcept { return events_.size(); }
  bool hasRoomFor(size_t bytes) const noexcept;
  // Drops the oldest events until there is room; returns how many. A batch without events has room for any
  // one event.
  [[nodiscard]] size_t makeRoomFor(size_t bytes);
  // bytes: the event's estimateSize.
  void append(Dictionary event, size_t bytes);

  // Every entry of `fields` is set in every event. Where the events would outgrow kMaxBytes by that, the
  // oldest are dropped, all but the last; returns how many. Costs little where the events have the entries
  // already.
  [[nodiscard]] size_t mergeIntoAll(const Dictionary& fields);
  // Leaves the batch empty.
  Array takeEvents();

 private:
  struct Held {
    Dictionary event;
    size_t bytes;
  };
  std::deque<Held> events_;
  size_t bytes_ = 0;
};

}  // namespace tarnel
