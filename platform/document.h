#pragma once

#include <cstddef>
#include <span>
#include <string>
#include <string_view>

#include "platform/base/error.h"
#include "platform/base/value.h"

// Structured documents in two forms, told apart by their first byte:
// text form: JSON (RFC 8259); a date is {"$date": "<RFC 3339>"}, data is {"$data": "<base-64>"};
// binary form: CBOR (RFC 8949); byte strings are data, tags 0 and 1 are dates, text keys only.
//
// Threads: all functions may be called from any thread.

namespace tarnel {

struct DocumentLimits {
  size_t bytes = 16U << 20U;
  size_t depth = 32;          // nesting of arrays and dictionaries
  size_t values = 1U << 20U;  // all values and keys together
};

// The error's description names what is wrong and where (byte offset).
Result<Value> parseDocument(std::string_view bytes, const DocumentLimits& limits = {});

// Text form on one line, or indented by two blanks. Doubles that JSON cannot hold are written as null.
std::string writeTextDocument(const Value& value, bool pretty = false);
// Binary form, deterministic for equal order of entries.
std::string writeBinaryDocument(const Value& value);

}  // namespace tarnel
