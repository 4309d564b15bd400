#pragma once

#include <cstddef>
#include <deque>
#include <optional>

#include "backends/https/event_filters.h"
#include "base/value.h"

namespace tarnel {

// Events that wait for a flush, in order of arrival. What waits is bounded, since a client may keep its
// backend from ever flushing.
//
// Threads: one at a time.
class EventBatch {
 public:
  static constexpr size_t kMaxEvents = 10000;
  static constexpr size_t kMaxBytes = 4U << 20U;  // as estimateSize counts

  // What is done to every event that is taken.
  struct Finish {
    Dictionary fields;                            // every entry is set in the event
    std::set<std::string, std::less<>> digested;  // those of them that are digests
    std::optional<EventFilters> filters;          // the event then passes them again; absent: it does not
  };

  // Memory that the event holds, roughly, in bytes.
  static size_t estimateSize(const Dictionary& event, const FilterTrace& trace = {});

  size_t size() const noexcept { return events_.size(); }
  bool hasRoomFor(size_t bytes) const noexcept;
  // Drops the oldest events until there is room; returns how many. A batch without events has room for any
  // one event.
  [[nodiscard]] size_t makeRoomFor(size_t bytes);
  // bytes: the event's estimateSize. The trace is needed where the event will pass filters again.
  void append(Dictionary event, size_t bytes, FilterTrace trace = {});

  // Every entry of `label` is set in the events that are held now; later ones do not get it. It is kept once
  // for all of them until they are taken, so that it takes no room from them. A later label with the same
  // entries takes the place of an earlier one.
  void labelAll(const Dictionary& label);

  // The oldest events, finished: all of them, or else as many as are no more than kMaxBytes together, but at
  // least one. What is set may be much larger than the events themselves; so that it is never in all of them
  // at the same time, the caller uses up what it got before it takes the next. An exception costs the events
  // that were taken until then; those that are left are as they were.
  Array takeEvents(const Finish& finish);

 private:
  struct Held {
    Dictionary event;
    FilterTrace trace;
    size_t bytes;
  };
  struct SizedField;

  static std::vector<SizedField> withSizes(const Dictionary& fields);
  static void setFields(Held& held, const std::vector<SizedField>& fields);
  void removeOldest();

  std::deque<Held> events_;
  size_t bytes_ = 0;
  Dictionary label_;
  size_t labelled_ = 0;  // so many of the oldest events get the label
};

}  // namespace tarnel
