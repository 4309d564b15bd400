#pragma once

#include <string>
#include <string_view>
#include <utility>

#include "base/error.h"
#include "base/value.h"

// Values as people type them on a command line.

namespace tarnel::ctl {

inline constexpr char kUsageErrorDomain[] = "TarnelUsageErrorDomain";

// `type` is one of "string", "int", "real", "bool", "date" (RFC 3339), "data" (base-64), "json" (also arrays
// and dictionaries); empty: a boolean for true and false, a number for what reads as one as a whole, else
// text.
Result<Value> typedValue(std::string_view text, std::string_view type);

// "KEY=VALUE" or "KEY:TYPE=VALUE". A key may hold colons: only a known type after the last one counts.
Result<std::pair<std::string, Value>> keyValuePair(std::string_view text);

// Name of the value's type, as `typedValue` takes it.
std::string_view typeName(const Value& value);

}  // namespace tarnel::ctl
