#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "base/error.h"
#include "base/value.h"

// Structured documents in two forms, told apart by their first byte:
// text form: JSON (RFC 8259); a date is {"$date": "<RFC 3339>"}, data is {"$data": "<base-64>"}; a dictionary
// with one of these as its only key is always meant so;
// binary form: CBOR (RFC 8949); byte strings are data, tags 0 and 1 are dates, text keys only, no other tags;
// null and undefined are null.
//
// A first byte below 0x80, or a UTF-8 byte-order mark, means text; every other byte means binary. A binary
// document whose own first byte would be below 0x80 (a number or text by itself) begins with the tag that
// marks CBOR (55799); writeBinaryDocument() puts it there, and it is accepted before any binary document.
//
// In both forms: any value may stand at the top; the last of equal keys wins; text must be UTF-8; integers
// that no 64 bits hold become doubles; bytes after the document are an error.
//
// Threads: all functions may be called from any thread.

namespace tarnel {

struct DocumentLimits {
  size_t bytes = 16U << 20U;
  size_t depth = 32;          // nesting of arrays and dictionaries
  size_t values = 1U << 20U;  // all values and keys together
};

inline constexpr char kDocumentErrorDomain[] = "TarnelDocumentErrorDomain";
inline constexpr int64_t kDocumentMalformed = 1;  // the document breaks the rules of its form
inline constexpr int64_t kDocumentTooLarge = 2;   // it goes beyond one of the limits

// The error's description names what is wrong and where (byte offset).
Result<Value> parseDocument(std::string_view bytes, const DocumentLimits& limits = {});

// Text form on one line, or indented by two blanks. What the text form cannot hold is written as null:
// doubles and dates that are not finite, dates outside the years 0 to 9999. Bytes that are not UTF-8 become
// U+FFFD.
std::string writeTextDocument(const Value& value, bool pretty = false);
// Binary form, deterministic for equal order of entries.
std::string writeBinaryDocument(const Value& value);

}  // namespace tarnel
