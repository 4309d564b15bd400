#pragma once

#include <array>
#include <cstdint>
#include <functional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "backends/https/profile_reader.h"
#include "base/value.h"

namespace tarnel {

// What is kept of an event's way through the filters, for an event that passes them again.
struct FilterTrace {
  int32_t method = 0;  // by which filters are chosen: the event's own, whatever became of its field
  int32_t status = 0;
  std::set<std::string, std::less<>> digested;  // fields whose values are digests already
};

// The filters of a client entry: which fields of which events are removed, or replaced by their SHA-256
// digest, before they leave the device.
//
// Threads: one at a time.
class EventFilters {
 public:
  // createFiltersFromArray: replaces the table by the descriptions, in their order. Without any description
  // the old table stays in force, so that an entry that names no fields takes no protection away.
  //
  // A description has "method" and "status" (numbers; absent: every one), "key" (the field's name, compared
  // ignoring case) and "action" ("remove" or "sha256"; anything else leaves the field as it is).
  void createFiltersFromArray(const std::vector<ProfileSection>& descriptions);

  // filterEvent: for each field, the first record that fits its name and the event's "_method" and "_status"
  // (0 when absent) decides. A value that is not text is digested by its readable text.
  void filterEvent(Dictionary& event) const;

  // Of an event that no filter has seen yet: its numbers, held to 32 bits, and no digests.
  static FilterTrace traceOf(const Dictionary& event);
  // filterEvent for an event that may have passed filters before, by this table or another. What is a digest
  // stays as it is unless it is to be removed; what is digested now is added to the trace.
  void filterAgain(Dictionary& event, FilterTrace& trace) const;

 private:
  enum class Action : int32_t { keep = 0, remove = 1, digest = 2 };
  struct Record {
    int32_t method;  // negative: every method
    int32_t status;  // negative: every status
    Action action;
    std::string key;  // folded
  };
  struct Range {
    uint32_t begin = 0;
    uint32_t end = 0;
  };
  // Names as long as this or longer share the last bucket.
  static constexpr size_t kLongName = 63;

  static Record recordFrom(const ProfileSection& description);
  static size_t bucketOf(std::string_view name) { return name.size() < kLongName ? name.size() : kLongName; }
  template <class MayDigest>
  void apply(Dictionary& event, int32_t method, int32_t status, MayDigest mayDigest) const;
  const Record* firstMatch(std::string_view name, int32_t method, int32_t status) const;
  const Record* firstInBucket(std::string_view name, int32_t method, int32_t status) const;

  // Ordered by bucket, then as described; most fields have a length that no record has and cost one look.
  std::vector<Record> _filters;
  std::array<Range, kLongName + 1> _buckets{};
};

}  // namespace tarnel
