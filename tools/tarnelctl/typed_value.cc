#include "tools/tarnelctl/typed_value.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <optional>

#include "formats/cryptography.h"
#include "formats/document.h"

namespace tarnel::ctl {
namespace {

constexpr std::array<std::string_view, 7> kTypes = {"string", "int", "real", "bool", "date", "data", "json"};

Error usage(std::string text) {
  return {kUsageErrorDomain, -1, std::move(text)};
}

template <class Number>
std::optional<Number> wholeNumber(std::string_view text) {
  Number number{};
  const auto* end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, number);
  return error == std::errc{} && stop == end ? std::optional(number) : std::nullopt;
}

std::optional<Value> integerFrom(std::string_view text) {
  if (const auto number = wholeNumber<int64_t>(text)) return Value(*number);
  if (const auto number = wholeNumber<uint64_t>(text)) return Value(*number);
  return std::nullopt;
}

Value inferred(std::string_view text) {
  if (text == "true") return true;
  if (text == "false") return false;
  if (auto integer = integerFrom(text)) return *integer;
  const bool numeric = !text.empty() && text.find_first_not_of("0123456789+-.eE") == std::string_view::npos;
  if (const auto real = numeric ? wholeNumber<double>(text) : std::nullopt) return *real;
  return Value(text);
}

// Dates share their syntax with documents.
Result<Value> dateFrom(std::string_view text) {
  if (text.find_first_of("\"\\") == std::string_view::npos) {
    auto parsed = parseDocument("{\"$date\":\"" + std::string(text) + "\"}");
    if (parsed && parsed->date() != nullptr) return parsed;
  }
  return usage("'" + std::string(text) + "' is no date: write it as 2026-01-31T12:00:00Z");
}

}  // namespace

Result<Value> typedValue(std::string_view text, std::string_view type) {
  const std::string quoted = "'" + std::string(text) + "'";
  if (!isValidUtf8(text)) return usage("a value is not UTF-8 text; check the terminal's character set");
  if (type.empty()) return inferred(text);
  if (type == "string") return Value(text);
  if (type == "int") {
    if (auto integer = integerFrom(text)) return *integer;
    return usage(quoted + " is no integer of 64 bits");
  }
  if (type == "real") {
    if (const auto real = wholeNumber<double>(text)) return Value(*real);
    return usage(quoted + " is no number");
  }
  if (type == "bool") {
    if (text == "true" || text == "1" || text == "yes") return Value(true);
    if (text == "false" || text == "0" || text == "no") return Value(false);
    return usage(quoted + " is no boolean: write true or false");
  }
  if (type == "date") return dateFrom(text);
  if (type == "data") {
    if (auto data = base64Decode(text)) return Value(std::move(*data));
    return usage(quoted + " is no base-64 text");
  }
  if (type == "json") {
    auto parsed = parseDocument(text);
    if (parsed) return parsed;
    return usage(quoted + " is no JSON: " + parsed.error().localizedDescription());
  }
  return usage("unknown type '" + std::string(type) + "': use string, int, real, bool, date, data or json");
}

Result<std::pair<std::string, Value>> keyValuePair(std::string_view text) {
  const auto equals = text.find('=');
  if (equals == std::string_view::npos || equals == 0) {
    return usage("'" + std::string(text) + "' is no KEY=VALUE");
  }
  auto key = text.substr(0, equals);
  std::string_view type;
  if (const auto colon = key.rfind(':'); colon != std::string_view::npos && colon != 0) {
    const auto candidate = key.substr(colon + 1);
    if (std::find(kTypes.begin(), kTypes.end(), candidate) != kTypes.end()) {
      type = candidate;
      key = key.substr(0, colon);
    }
  }
  auto value = typedValue(text.substr(equals + 1), type);
  if (!value) return value.error();
  return std::pair(std::string(key), *std::move(value));
}

std::string_view typeName(const Value& value) {
  switch (value.type()) {
    case Value::Type::boolean:
      return "bool";
    case Value::Type::integer:
    case Value::Type::unsignedInteger:
      return "int";
    case Value::Type::real:
      return "real";
    case Value::Type::date:
      return "date";
    case Value::Type::string:
      return "string";
    case Value::Type::data:
      return "data";
    default:
      return "json";
  }
}

}  // namespace tarnel::ctl
