#pragma once

#include <string>
#include <vector>

#include "base/value.h"

namespace tarnel {

enum class FindingSeverity { warning, error };

// One thing that is wrong (or probably not meant) in an inner document.
struct StorebagFinding {
  FindingSeverity severity;
  std::string path;  // "seed.httppost.clients[0].filters"; empty for the whole document
  std::string text;  // "missing: the backend will stay disabled"

  // "seed.httppost.clients[0].filters: missing: the backend will stay disabled"
  std::string description() const;
  friend bool operator==(const StorebagFinding&, const StorebagFinding&) = default;
};

// Everything the daemon would refuse, take for absent or probably do otherwise than its author thinks.
// An error keeps the daemon from using the document or a part of it; a warning does not.
// At most kMaxStorebagFindings findings, in the order of the document. Threads: any.
inline constexpr size_t kMaxStorebagFindings = 200;
std::vector<StorebagFinding> validateStorebag(const Value& inner);

bool hasErrors(const std::vector<StorebagFinding>& findings);

}  // namespace tarnel
