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

// Equal in every respect, which is quickly seen; of others this is not asked.
bool isSame(const Value& a, const Value& b) {
  const bool isPlain = a.type() == Value::Type::string || a.type() == Value::Type::boolean ||
                       a.type() == Value::Type::integer || a.type() == Value::Type::unsignedInteger;
  return isPlain && a == b;
}

}  // namespace

struct EventBatch::SizedField {
  const std::string& key;
  const Value& value;
  size_t entryBytes;
  size_t valueBytes;
};

std::vector<EventBatch::SizedField> EventBatch::withSizes(const Dictionary& fields) {
  std::vector<SizedField> sized;
  sized.reserve(fields.size());
  for (const auto& [key, value] : fields) {
    const size_t bytes = heapSize(value);
    sized.push_back({key, value, sizeof(Dictionary::Entry) + heapSize(key) + bytes, bytes});
  }
  return sized;
}

// Costs little where the event has the entries already.
void EventBatch::setFields(Held& held, const std::vector<SizedField>& fields) {
  for (const auto& field : fields) {
    held.trace.digested.erase(field.key);
    const Value* old = held.event.find(field.key);
    if (old != nullptr && isSame(*old, field.value)) continue;
    if (old == nullptr) {
      held.bytes += field.entryBytes;
    } else {
      held.bytes = held.bytes + field.valueBytes - heapSize(*old);
    }
    held.event.set(field.key, field.value);
  }
}

size_t EventBatch::estimateSize(const Dictionary& event, const FilterTrace& trace) {
  constexpr size_t kNode = 4 * sizeof(void*);  // of a set, beside the text
  size_t bytes = sizeof(Held);
  for (const auto& [key, value] : event) bytes += sizeof(Dictionary::Entry) + heapSize(key) + heapSize(value);
  for (const auto& name : trace.digested) bytes += kNode + sizeof(std::string) + heapSize(name);
  return bytes;
}

bool EventBatch::hasRoomFor(size_t bytes) const noexcept {
  return events_.empty() || (events_.size() < kMaxEvents && bytes_ + bytes <= kMaxBytes);
}

void EventBatch::removeOldest() {
  events_.pop_front();
  if (labelled_ > 0) --labelled_;
}

size_t EventBatch::makeRoomFor(size_t bytes) {
  size_t dropped = 0;
  for (; !hasRoomFor(bytes); ++dropped) {
    bytes_ -= events_.front().bytes;
    removeOldest();
  }
  return dropped;
}

void EventBatch::append(Dictionary event, size_t bytes, FilterTrace trace) {
  events_.push_back({std::move(event), std::move(trace), bytes});
  bytes_ += bytes;
}

void EventBatch::labelAll(const Dictionary& label) {
  label_.merge(label);
  labelled_ = events_.size();
}

Array EventBatch::takeEvents(const Finish& finish) {
  const std::vector<SizedField> label = withSizes(label_);
  const std::vector<SizedField> fields = withSizes(finish.fields);
  Array events;
  events.reserve(events_.size());
  size_t bytes = 0;
  while (!events_.empty()) {
    const bool hasLabel = labelled_ > 0;
    bytes_ -= events_.front().bytes;
    Held held = std::move(events_.front());
    removeOldest();
    if (hasLabel) setFields(held, label);
    setFields(held, fields);
    if (finish.filters) {
      held.trace.digested.insert(finish.digested.begin(), finish.digested.end());
      finish.filters->filterAgain(held.event, held.trace);
      held.bytes = estimateSize(held.event, held.trace);
    }
    bytes += held.bytes;
    // Finished once more with the next, it becomes what it is now.
    if (!events.empty() && bytes > kMaxBytes) {
      bytes_ += held.bytes;
      events_.push_front(std::move(held));
      if (hasLabel) ++labelled_;
      return events;
    }
    events.append(Value(std::move(held.event)));
  }
  return events;
}

}  // namespace tarnel
