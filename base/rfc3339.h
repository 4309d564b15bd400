#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/value.h"

namespace tarnel {

// The date of an RFC 3339 text, such as "2026-01-31T12:00:00.25+01:00"; nothing when it is none. A leap
// second (:60) counts as the first second of the next minute.
std::optional<Date> parseRfc3339(std::string_view text);

// RFC 3339 in UTC ("2026-01-31T11:00:00.25Z") that reads back as the very same date; nothing when the date
// is not finite or lies outside the years 0 to 9999.
std::optional<std::string> rfc3339Text(Date date);

}  // namespace tarnel
