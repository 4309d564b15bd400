#include "backends/https/event_batch.h"

#include <utility>

namespace tarnel {
namespace {

// What strings keep inside themselves costs no memory of its own.
size_t heapSize(const std::string& text) {
  constexpr size_t kInside = 15;
  return text.size() > kInside ? text.size() + 1 : 0;
}

size_t heapSize(const Value& value) {
  if (const auto* text = value.string()) return heapSize(*text);
  if (const auto* data = value.data()) return data->size();
  if (const auto* dictionary = value.dictionary()) return EventBatch::estimateSize(*dictionary);
  const auto* array = value.array();
  if (array == nullptr) return 0;
  size_t bytes = 0;
  for (const auto& item : *array) bytes += sizeof(Value) + heapSize(item);
  return bytes;
}

}  // namespace

size_t EventBatch::estimateSize(const Dictionary& event) {
  size_t bytes = sizeof(Held);
  for (const auto& [key, value] : event) bytes += sizeof(Dictionary::Entry) + heapSize(key) + heapSize(value);
  return bytes;
}

bool EventBatch::hasRoomFor(size_t bytes) const noexcept {
  return events_.empty() || (events_.size() < kMaxEvents && bytes_ + bytes <= kMaxBytes);
}

size_t EventBatch::makeRoomFor(size_t bytes) {
  size_t dropped = 0;
  for (; !hasRoomFor(bytes); ++dropped) {
    bytes_ -= events_.front().bytes;
    events_.pop_front();
  }
  return dropped;
}

void EventBatch::append(Dictionary event, size_t bytes) {
  events_.push_back({std::move(event), bytes});
  bytes_ += bytes;
}

size_t EventBatch::mergeIntoAll(const Dictionary& fields) {
  if (bytes_ + estimateSize(fields) * events_.size() <= kMaxBytes) {
    for (auto& held : events_) held.event.merge(fields);
    return 0;
  }
  bytes_ = 0;
  for (size_t left = events_.size(); left > 0; --left) {
    Held& held = events_[left - 1];
    held.event.merge(fields);
    held.bytes = estimateSize(held.event);
    if (left < events_.size() && bytes_ + held.bytes > kMaxBytes) {
      events_.erase(events_.begin(), events_.begin() + static_cast<std::ptrdiff_t>(left));
      return left;
    }
    bytes_ += held.bytes;
  }
  return 0;
}

Array EventBatch::takeEvents() {
  Array events;
  events.reserve(events_.size());
  for (auto& held : events_) events.append(Value(std::move(held.event)));
  events_.clear();
  bytes_ = 0;
  return events;
}

}  // namespace tarnel
