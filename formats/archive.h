#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "base/error.h"
#include "base/value.h"

// Keyed object archives: a value and all that is in it as a table of objects, in which equal objects stand
// once and are referred to by their place. docs/keyed-archive.md describes the format.
//
// Threads: all functions may be called from any thread.

namespace tarnel {

struct ArchiveLimits {
  size_t bytes = 16U << 20U;  // of the archive; of all text and data together, each as often as it occurs
  size_t depth = 32;          // nesting of arrays and dictionaries
  // All values and keys together, each as often as it occurs; and the objects of the table.
  size_t values = 1U << 18U;
};

inline constexpr char kArchiveErrorDomain[] = "TarnelArchiveErrorDomain";
inline constexpr int64_t kArchiveMalformed = 1;  // the archive breaks the rules of the format
inline constexpr int64_t kArchiveTooLarge = 2;   // archive or value goes beyond one of the limits
inline constexpr int64_t kArchiveNotText = 3;    // the value holds text or a key that is not UTF-8

// The archive of the value. An error names what cannot be archived, and what to do.
Result<std::string> archiveObject(const Value& root, const ArchiveLimits& limits = {});

// The value in the archive, of which nothing is trusted: an archive that claims, or by many references comes
// to, more than the limits is refused before anything is set aside for it. Equal objects of one archive share
// their storage.
Result<Value> unarchiveObject(std::string_view archive, const ArchiveLimits& limits = {});

}  // namespace tarnel
