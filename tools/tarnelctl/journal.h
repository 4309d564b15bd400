#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace tarnel::ctl {

// The system's journal, read entry by entry. Results below 0 are negative errnos.
class Journal {
 public:
  Journal() = default;
  Journal(const Journal&) = delete;
  Journal& operator=(const Journal&) = delete;
  virtual ~Journal() = default;

  // From now on only entries with this "FIELD=value" are met; with matches of several fields, those that have
  // them all.
  virtual int addMatch(const std::string& match) = 0;
  // Before the first entry, and behind the last.
  virtual int seekHead() = 0;
  virtual int seekTail() = 0;
  // Goes back over `count` entries, or as many as there are, to the last of them; how many these were.
  virtual int previousSkip(uint64_t count) = 0;
  // Goes on to the next entry; 0 when there is none.
  virtual int next() = 0;
  // Returns when there may be new entries.
  virtual int wait() = 0;

  // Of the entry that was gone to: when it was written, in microseconds since 1970, and what a field holds.
  virtual std::optional<int64_t> microseconds() = 0;
  virtual std::optional<std::string> field(const char* name) = 0;
};

}  // namespace tarnel::ctl
