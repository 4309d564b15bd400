#include "tools/storebag/storebag_findings.h"

#include <algorithm>
#include <cmath>
#include <numeric>

namespace tarnel {

std::string StorebagFinding::description() const {
  return path.empty() ? text : path + ": " + text;
}

bool hasErrors(const std::vector<StorebagFinding>& findings) {
  return std::any_of(findings.begin(), findings.end(), [](const StorebagFinding& finding) {
    return finding.severity == FindingSeverity::error;
  });
}

namespace storebag_check {
namespace {

size_t editDistance(std::string_view a, std::string_view b) {
  std::vector<size_t> row(b.size() + 1);
  std::iota(row.begin(), row.end(), size_t{0});
  for (size_t i = 0; i < a.size(); ++i) {
    size_t diagonal = row[0];
    row[0] = i + 1;
    for (size_t j = 0; j < b.size(); ++j) {
      const size_t substituted = diagonal + (a[i] == b[j] ? 0U : 1U);
      diagonal = row[j + 1];
      row[j + 1] = std::min({row[j] + 1, row[j + 1] + 1, substituted});
    }
  }
  return row.back();
}

}  // namespace

void Findings::add(FindingSeverity severity, std::string path, std::string text) {
  if (list_.size() + 1 < kMaxStorebagFindings) {
    list_.push_back({severity, std::move(path), std::move(text)});
  } else if (list_.size() < kMaxStorebagFindings) {
    list_.push_back({severity, "", "more is wrong than is listed here"});
  } else if (severity == FindingSeverity::error) {
    list_.back().severity = severity;
  }
}

bool isOfKind(const Value& value, Kind kind) {
  switch (kind) {
    case Kind::any:
      return !value.isNull();
    case Kind::anything:
      return true;
    case Kind::text:
      return value.string() != nullptr;
    case Kind::number:
      return value.isNumber();
    case Kind::list:
      return value.array() != nullptr;
    case Kind::dictionary:
      return value.dictionary() != nullptr;
    case Kind::texts:
      return value.array() != nullptr &&
             std::all_of(value.array()->begin(), value.array()->end(),
                         [](const Value& item) { return item.string() != nullptr; });
  }
  return false;
}

std::string kindName(Kind kind) {
  switch (kind) {
    case Kind::any:
    case Kind::anything:
      return "a value";
    case Kind::text:
      return "a text";
    case Kind::number:
      return "a number";
    case Kind::list:
      return "a list";
    case Kind::dictionary:
      return "a dictionary";
    case Kind::texts:
      return "a list of texts";
  }
  return "";
}

std::string typeName(const Value& value) {
  switch (value.type()) {
    case Value::Type::null:
      return "null";
    case Value::Type::boolean:
      return "a boolean";
    case Value::Type::integer:
    case Value::Type::unsignedInteger:
    case Value::Type::real:
      return "a number";
    case Value::Type::date:
      return "a date";
    case Value::Type::string:
      return "a text";
    case Value::Type::data:
      return "data";
    case Value::Type::array:
      return "a list";
    case Value::Type::dictionary:
      return "a dictionary";
  }
  return "";
}

std::string joined(std::string_view path, std::string_view key) {
  return path.empty() ? std::string(key) : std::string(path) + "." + std::string(key);
}

std::string indexed(std::string_view path, size_t index) {
  return std::string(path) + "[" + std::to_string(index) + "]";
}

std::string_view nearestKey(std::string_view key, std::span<const KeyRule> rules) {
  std::string_view nearest;
  size_t least = 3;
  for (const KeyRule& rule : rules) {
    if (key.size() > 64) break;
    const size_t distance = editDistance(key, rule.key);
    if (distance < least) {
      least = distance;
      nearest = rule.key;
    }
  }
  return nearest;
}

void checkKeys(const Dictionary& dictionary, std::span<const KeyRule> rules, std::string_view path,
               Findings& findings) {
  for (const auto& [key, value] : dictionary) {
    const auto rule = std::find_if(rules.begin(), rules.end(),
                                   [&key](const KeyRule& candidate) { return candidate.key == key; });
    if (rule == rules.end()) {
      const std::string_view nearest = nearestKey(key, rules);
      findings.warning(joined(path, key), nearest.empty() ? "unknown key: nothing reads it"
                                                          : "unknown key: nothing reads it; did you mean \"" +
                                                                std::string(nearest) + "\"?");
    } else if (!isOfKind(value, rule->kind)) {
      const bool mixedList = rule->kind == Kind::texts && value.array() != nullptr;
      findings.error(joined(path, key),
                     "must be " + kindName(rule->kind) + ", but is " +
                         (mixedList ? "a list that holds other things: the daemon leaves those out"
                                    : typeName(value) + ": the daemon takes it for " +
                                          (rule->wrongMatchesNobody ? "matching nobody" : "absent")));
    }
  }
}

const Value* valueOf(const Dictionary& dictionary, std::string_view key, Kind kind) {
  const Value* value = dictionary.find(key);
  return value != nullptr && isOfKind(*value, kind) ? value : nullptr;
}

std::optional<int32_t> checkInteger(const Dictionary& dictionary, std::string_view key, std::string_view path,
                                    Findings& findings) {
  const Value* number = valueOf(dictionary, key, Kind::number);
  if (number == nullptr) return std::nullopt;
  const double written = number->doubleValue();
  const int32_t read = number->boundedInt32Value();
  if (written != read) {
    const bool isFraction = std::trunc(written) == read;
    findings.warning(joined(path, key),
                     "counts as " + std::to_string(read) + ": " +
                         (isFraction ? "what stands behind the point is cut off"
                                     : "only numbers from -2147483648 to 2147483647 are read as they stand"));
  }
  return read;
}

void checkURL(const Dictionary& dictionary, std::string_view key, std::string_view path, Findings& findings) {
  const std::string* url = findString(dictionary, key);
  if (url == nullptr || url->starts_with("{{LAB_URL}}")) return;
  const bool secure = url->starts_with("https://") && url->size() > 8;
  const bool plain = url->starts_with("http://") && url->size() > 7;
  if (!secure && !plain) {
    findings.error(joined(path, key), "must be an http or https address, but is \"" + *url + "\"");
  } else if (url->find_first_of(" \t\r\n\"<>") != std::string::npos) {
    findings.error(joined(path, key), "an address holds no blanks, quotes or angle brackets");
  } else if (plain) {
    findings.warning(joined(path, key), "http: what is posted there can be read and changed on its way");
  }
}

}  // namespace storebag_check
}  // namespace tarnel
