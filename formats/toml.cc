#include "formats/toml.h"

#include <toml++/toml.h>

#include <chrono>

namespace tarnel {

namespace {

// Seconds since 1970; without an offset the time counts as UTC.
Date dateOf(const toml::date_time& moment) {
  const auto day =
      std::chrono::sys_days(std::chrono::year(moment.date.year) / std::chrono::month(moment.date.month) /
                            std::chrono::day(moment.date.day));
  int64_t seconds = static_cast<int64_t>(day.time_since_epoch().count()) * 86400 + moment.time.hour * 3600 +
                    moment.time.minute * 60 + moment.time.second;
  if (moment.offset) seconds -= static_cast<int64_t>(moment.offset->minutes) * 60;
  return Date{static_cast<double>(seconds) + static_cast<double>(moment.time.nanosecond) / 1e9};
}

Value scalarOf(const toml::node& node) {
  if (const auto* text = node.as_string()) return Value(text->get());
  if (const auto* number = node.as_integer()) return Value(number->get());
  if (const auto* real = node.as_floating_point()) return Value(real->get());
  if (const auto* flag = node.as_boolean()) return Value(flag->get());
  if (const auto* moment = node.as_date_time()) return Value(dateOf(moment->get()));
  if (const auto* day = node.as_date()) return Value(dateOf(toml::date_time(day->get(), toml::time())));
  return Value();
}

// The parser itself bounds the nesting.
TomlNode convert(const toml::node& node) {
  TomlNode result;
  result.line = node.source().begin.line;
  if (const auto* table = node.as_table()) {
    result.kind = TomlNode::Kind::table;
    result.entries.reserve(table->size());
    for (const auto& [key, entry] : *table)
      result.entries.push_back({std::string(key.str()), convert(entry)});
  } else if (const auto* array = node.as_array()) {
    result.kind = TomlNode::Kind::array;
    result.elements.reserve(array->size());
    for (const auto& element : *array) result.elements.push_back(convert(element));
  } else {
    result.scalar = scalarOf(node);
  }
  return result;
}

}  // namespace

const TomlNode* TomlNode::find(std::string_view key) const {
  for (const auto& [name, node] : entries) {
    if (name == key) return &node;
  }
  return nullptr;
}

Value TomlNode::value() const {
  if (kind == Kind::scalar) return scalar;
  if (kind == Kind::array) {
    Array array;
    array.reserve(elements.size());
    for (const TomlNode& element : elements) array.append(element.value());
    return array;
  }
  Dictionary dictionary;
  dictionary.reserve(entries.size());
  for (const auto& [key, node] : entries) dictionary.set(key, node.value());
  return dictionary;
}

Result<TomlNode> parseToml(std::string_view text) {
  try {
    return convert(toml::parse(text));
  } catch (const toml::parse_error& error) {
    return Error(kTomlErrorDomain, static_cast<int64_t>(error.source().begin.line),
                 std::string(error.description()));
  }
}

}  // namespace tarnel
