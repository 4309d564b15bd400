#include "backends/https/event_batch.h"

#include <utility>
#include <vector>

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

struct SizedField {
  const std::string& key;
  const Value& value;
  size_t entryBytes;
  size_t valueBytes;
};

std::vector<SizedField> withSizes(const Dictionary& fields) {
  std::vector<SizedField> sized;
  sized.reserve(fields.size());
  for (const auto& [key, value] : fields) {
    const size_t bytes = heapSize(value);
    sized.push_back({key, value, sizeof(Dictionary::Entry) + heapSize(key) + bytes, bytes});
  }
  return sized;
}

// Equal in every respect, which is quickly seen; of others this is not asked.
bool isSame(const Value& a, const Value& b) {
  const bool isPlain = a.type() == Value::Type::string || a.type() == Value::Type::boolean ||
                       a.type() == Value::Type::integer || a.type() == Value::Type::unsignedInteger;
  return isPlain && a == b;
}

struct SizeChange {
  size_t more = 0;
  size_t less = 0;
};

SizeChange setField(Dictionary& event, const SizedField& field) {
  const Value* old = event.find(field.key);
  if (old != nullptr && isSame(*old, field.value)) return {};
  const SizeChange change =
      old == nullptr ? SizeChange{field.entryBytes, 0} : SizeChange{field.valueBytes, heapSize(*old)};
  event.set(field.key, field.value);
  return change;
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
  const std::vector<SizedField> sized = withSizes(fields);
  size_t bytes = 0;
  for (size_t left = events_.size(); left > 0; --left) {
    Held& held = events_[left - 1];
    for (const auto& field : sized) {
      const SizeChange change = setField(held.event, field);
      held.bytes = held.bytes + change.more - change.less;
    }
    if (left < events_.size() && bytes + held.bytes > kMaxBytes) {
      events_.erase(events_.begin(), events_.begin() + static_cast<std::ptrdiff_t>(left));
      bytes_ = bytes;
      return left;
    }
    bytes += held.bytes;
  }
  bytes_ = bytes;
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
