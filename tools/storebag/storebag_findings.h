#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "base/value.h"
#include "tools/storebag/storebag_validation.h"

// What the checks of the storebag's parts share; used within this folder only.

namespace tarnel::storebag_check {

enum class Kind {
  any,
  anything,  // null too
  text,
  number,
  texts,
  list,
  dictionary
};

struct KeyRule {
  std::string_view key;
  Kind kind;
  bool wrongMatchesNobody = false;  // instead of counting as absent when it is of another kind
};

class Findings {
 public:
  void error(std::string path, std::string text) {
    add(FindingSeverity::error, std::move(path), std::move(text));
  }
  void warning(std::string path, std::string text) {
    add(FindingSeverity::warning, std::move(path), std::move(text));
  }
  std::vector<StorebagFinding> take() { return std::move(list_); }

 private:
  void add(FindingSeverity severity, std::string path, std::string text);

  std::vector<StorebagFinding> list_;
};

bool isOfKind(const Value& value, Kind kind);
// "a text", "a number", "a list of texts" and so on.
std::string kindName(Kind kind);
std::string typeName(const Value& value);
std::string joined(std::string_view path, std::string_view key);
std::string indexed(std::string_view path, size_t index);

// Every entry against the rules: a value of another kind is an error, a key that no rule names a warning
// (with the key that was probably meant). The dictionary's values of the right kind are what `valueOf` gives.
void checkKeys(const Dictionary& dictionary, std::span<const KeyRule> rules, std::string_view path,
               Findings& findings);

// The value under the key when it is of the kind, else null.
const Value* valueOf(const Dictionary& dictionary, std::string_view key, Kind kind);

// The 32-bit integer that the daemon reads from a number, nothing without one. A finding when that is another
// number than the one that is written.
std::optional<int32_t> checkInteger(const Dictionary& dictionary, std::string_view key, std::string_view path,
                                    Findings& findings);

// An http or https address; anything else is a finding.
void checkURL(const Dictionary& dictionary, std::string_view key, std::string_view path, Findings& findings);

// The key among the rules that was probably meant, or empty.
std::string_view nearestKey(std::string_view key, std::span<const KeyRule> rules);

// One element of httppost's "clients".
void checkClientEntry(const Dictionary& entry, const std::string& path, Findings& findings);

}  // namespace tarnel::storebag_check
