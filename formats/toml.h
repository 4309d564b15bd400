#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/error.h"
#include "base/value.h"

// TOML texts (version 1.0) as values that know their line.
//
// Threads: any; a TomlNode is immutable once parsed.

namespace tarnel {

struct TomlEntry;

// One value of a document. Exactly one of the three forms is filled.
struct TomlNode {
  enum class Kind : uint8_t { scalar, array, table };

  Kind kind = Kind::scalar;
  uint32_t line = 0;               // 1 and up
  Value scalar;                    // null: a local time, which no value can hold
  std::vector<TomlNode> elements;  // of an array
  std::vector<TomlEntry> entries;  // of a table, sorted by key

  // The entry of a table, or null.
  const TomlNode* find(std::string_view key) const;
  // All of it as one value. A date-time without offset counts as UTC; a local time becomes null.
  Value value() const;
};

struct TomlEntry {
  std::string key;
  TomlNode node;
};

inline constexpr char kTomlErrorDomain[] = "TarnelTomlErrorDomain";

// The document's top table. The error's code is the line, its description says what is wrong there.
Result<TomlNode> parseToml(std::string_view text);

// A document with these entries, in their order, one per line; nested dictionaries are inline tables.
// Fails, naming the key, when one of them cannot stand in TOML: null, data, text that is not UTF-8, a number
// beyond the signed 64-bit range, a date outside the years 0000 to 9999, nesting beyond 32.
Result<std::string> writeToml(const Dictionary& entries);

}  // namespace tarnel
