#pragma once

#include <string>
#include <string_view>

#include "base/value.h"
#include "tools/receiving/event_check.h"

namespace tarnel::lab {

// What the query of a file upload says, decoded; absent where it says nothing.
struct UploadQuery {
  MaybeString uuid;
  MaybeString sequence;
  MaybeString description;
  MaybeString filename;
  MaybeString raw;

  friend bool operator==(const UploadQuery&, const UploadQuery&) = default;
};

// Reads "uuid=...&sequence=...&description=...&filename=...&raw=..." as the service writes it: percent signs
// are decoded and plus signs are not blanks; a file name may hold ampersands, and reaches up to the last
// "&raw=". Threads: any.
UploadQuery readUploadQuery(std::string_view query);

// What is not as the service sends it.
void checkUploadQuery(const UploadQuery& query, Problems& problems);

}  // namespace tarnel::lab
