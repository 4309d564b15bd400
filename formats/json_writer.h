#pragma once

#include <string>

#include "base/value.h"

namespace tarnel {

enum class JsonStyle { compact, pretty };

// Writes the value as JSON (RFC 8259) to the end of `out`, which callers may keep and reuse. Booleans are
// true and false, dates their seconds since 1970, null is null. Doubles are the shortest text that reads back
// as the same double, with ".0" when they are whole, so that a reader still sees a real number; keys keep
// their order. Pretty text is indented by two blanks. Returns false, leaving `out` as it was, when the value
// cannot stand in JSON: text that is not UTF-8, doubles that are not finite, data. Threads: any.
bool writeJson(const Value& value, JsonStyle style, std::string& out);
bool writeJson(const Dictionary& value, JsonStyle style, std::string& out);

}  // namespace tarnel
