#include "backends/https/event_filters.h"

#include <algorithm>

#include "backends/tarnel_backend.h"
#include "base/text_case.h"

namespace tarnel {
namespace {

// Held to the bounds like the numbers of the filters, so that none fits an event by what it is modulo 2^32.
int32_t integerField(const Dictionary& event, std::string_view key) {
  const auto* value = event.find(key);
  return value == nullptr ? 0 : value->boundedInt32Value();
}

}  // namespace

EventFilters::Record EventFilters::recordFrom(const ProfileSection& description) {
  const auto* method = description.findNumber("method");
  const auto* status = description.findNumber("status");
  const auto* key = description.findString("key");
  const auto* action = description.findString("action");
  Record record{-1, -1, Action::keep, {}};
  if (method != nullptr) record.method = method->boundedInt32Value();
  if (status != nullptr) record.status = status->boundedInt32Value();
  if (key != nullptr) record.key = foldCase(*key);
  if (action != nullptr && *action == "remove") record.action = Action::remove;
  if (action != nullptr && *action == "sha256") record.action = Action::digest;
  return record;
}

void EventFilters::createFiltersFromArray(const std::vector<ProfileSection>& descriptions) {
  if (descriptions.empty()) return;
  _filters.clear();
  for (const auto& description : descriptions) {
    // A record without a key fits no field.
    if (description.findString("key") != nullptr) _filters.push_back(recordFrom(description));
  }
  std::stable_sort(_filters.begin(), _filters.end(),
                   [](const Record& a, const Record& b) { return bucketOf(a.key) < bucketOf(b.key); });
  _buckets.fill({});
  for (uint32_t i = 0; i < _filters.size(); ++i) {
    auto& bucket = _buckets[bucketOf(_filters[i].key)];
    if (bucket.end == 0) bucket.begin = i;
    bucket.end = i + 1;
  }
}

const EventFilters::Record* EventFilters::firstMatch(std::string_view name, int32_t method,
                                                     int32_t status) const {
  // Nearly all names are ASCII. Another one may fold to a name of another length.
  if (!isAscii(name)) return firstInBucket(foldCase(name), method, status);
  return firstInBucket(name, method, status);
}

// The name has the length that it has when folded.
const EventFilters::Record* EventFilters::firstInBucket(std::string_view name, int32_t method,
                                                        int32_t status) const {
  const auto bucket = _buckets[bucketOf(name)];
  for (uint32_t i = bucket.begin; i < bucket.end; ++i) {
    const auto& record = _filters[i];
    if (!equalsFolded(record.key, name)) continue;
    if (record.method >= 0 && record.method != method) continue;
    if (record.status >= 0 && record.status != status) continue;
    return &record;
  }
  return nullptr;
}

// Asks `mayDigest` with a field's name before it puts a digest there.
template <class MayDigest>
void EventFilters::apply(Dictionary& event, int32_t method, int32_t status, MayDigest mayDigest) const {
  if (_filters.empty()) return;
  const auto matchesNothing = [this, method, status](const Dictionary::Entry& entry) {
    return firstMatch(entry.first, method, status) == nullptr;
  };
  if (std::all_of(event.begin(), event.end(), matchesNothing)) return;
  event.editEntries([this, method, status, &mayDigest](const std::string& name, Value& value) {
    const auto* record = firstMatch(name, method, status);
    if (record == nullptr || record->action == Action::keep) return true;
    if (record->action == Action::remove) return false;
    if (!mayDigest(name)) return true;
    const auto* text = value.string();
    value = Value(TarnelBackend::convertIntoSHA256(text != nullptr ? *text : value.description()));
    return true;
  });
}

void EventFilters::filterEvent(Dictionary& event) const {
  apply(event, integerField(event, "_method"), integerField(event, "_status"),
        [](const std::string& /*name*/) { return true; });
}

FilterTrace EventFilters::traceOf(const Dictionary& event) {
  return {integerField(event, "_method"), integerField(event, "_status"), {}};
}

void EventFilters::filterAgain(Dictionary& event, FilterTrace& trace) const {
  apply(event, trace.method, trace.status,
        [&trace](const std::string& name) { return trace.digested.insert(name).second; });
}

}  // namespace tarnel
