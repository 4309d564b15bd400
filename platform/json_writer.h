#pragma once

#include <string>

#include "platform/base/value.h"

namespace tarnel {

enum class JsonStyle { compact, pretty };

// Writes the value as JSON (RFC 8259) to the end of `out`, which callers may keep and reuse. Booleans are
// true and false, dates their seconds since 1970. Returns false, leaving `out` as it was, when the value
// cannot stand in JSON: text that is not UTF-8, doubles that are not finite, data.
bool writeJson(const Value& value, JsonStyle style, std::string& out);
bool writeJson(const Dictionary& value, JsonStyle style, std::string& out);

}  // namespace tarnel
