#include "base/value.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstring>
#include <ctime>
#include <limits>

#include "base/hex.h"

namespace tarnel {
namespace {

bool isBlank(char c) {
  return c == ' ' || (c >= '\t' && c <= '\r');
}

std::string_view skipBlanks(std::string_view text) {
  while (!text.empty() && isBlank(text.front())) text.remove_prefix(1);
  return text;
}

// The text of a number: without blanks and without a plus sign, which std::from_chars does not know.
std::string_view numberText(std::string_view text) {
  text = skipBlanks(text);
  if (!text.starts_with('+')) return text;
  text.remove_prefix(1);
  return text.starts_with('-') ? std::string_view() : text;
}

int64_t leadingInteger(std::string_view text) {
  text = numberText(text);
  int64_t result = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), result);
  if (error == std::errc::result_out_of_range) {
    return text.starts_with('-') ? std::numeric_limits<int64_t>::min() : std::numeric_limits<int64_t>::max();
  }
  return error == std::errc{} ? result : 0;
}

// A number that no double holds: infinite when it is too large, zero when it is too small.
double outOfRangeReal(std::string_view number) {
  const bool negative = number.starts_with('-');
  if (negative) number.remove_prefix(1);
  const size_t exponent = number.find_first_of("eE");
  const bool small = exponent != std::string_view::npos ? number.substr(exponent + 1).starts_with('-')
                                                        : number.find_first_not_of('0') == number.find('.');
  const double magnitude = small ? 0.0 : std::numeric_limits<double>::infinity();
  return negative ? -magnitude : magnitude;
}

double leadingReal(std::string_view text) {
  text = numberText(text);
  // Only digits begin a number: std::from_chars would take "nan" and "infinity" too.
  const size_t first = text.starts_with('-') ? 1 : 0;
  if (text.size() <= first || std::isalpha(static_cast<unsigned char>(text[first])) != 0) return 0;
  double result = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), result);
  if (error == std::errc::result_out_of_range) {
    return outOfRangeReal(text.substr(0, static_cast<size_t>(end - text.data())));
  }
  return error == std::errc{} ? result : 0;
}

int64_t saturated(double value) {
  constexpr double kLimit = 9223372036854775808.0;  // 2^63
  if (std::isnan(value)) return 0;
  if (value >= kLimit) return std::numeric_limits<int64_t>::max();
  if (value < -kLimit) return std::numeric_limits<int64_t>::min();
  return static_cast<int64_t>(value);
}

void appendQuoted(std::string& out, std::string_view text) {
  out += '"';
  for (const char c : text) {
    if (c == '"' || c == '\\') {
      out += '\\';
      out += c;
    } else if (c == '\n') {
      out += "\\n";
    } else {
      out += c;
    }
  }
  out += '"';
}

template <std::integral Number>
std::string decimal(Number number) {
  std::array<char, 24> buffer{};
  const auto [end, error] = std::to_chars(buffer.data(), buffer.data() + buffer.size(), number);
  return error == std::errc{} ? std::string(buffer.data(), end) : std::string();
}

std::string decimal(double number) {
  std::array<char, kRealTextSize> buffer{};
  return std::string(writeReal(number, buffer));
}

void appendInside(std::string& out, const Value& value) {
  if (const auto* text = value.string()) {
    appendQuoted(out, *text);
  } else {
    out += value.description();
  }
}

}  // namespace

int64_t Value::int64Value() const noexcept {
  switch (type()) {
    case Type::boolean:
      return *boolean() ? 1 : 0;
    case Type::integer:
      return *integer();
    case Type::unsignedInteger:
      return static_cast<int64_t>(*unsignedInteger());
    case Type::real:
      return saturated(*real());
    case Type::string:
      return leadingInteger(*string());
    default:
      return 0;
  }
}

bool Value::hasInteger() const noexcept {
  const auto* held = string();
  if (held == nullptr) return isNumber();
  auto text = numberText(*held);
  if (text.starts_with('-')) text.remove_prefix(1);
  return !text.empty() && text.front() >= '0' && text.front() <= '9';
}

uint64_t Value::uint64Value() const noexcept {
  return static_cast<uint64_t>(int64Value());
}

int32_t Value::boundedInt32Value() const noexcept {
  using Limits = std::numeric_limits<int32_t>;
  if (unsignedInteger() != nullptr) return Limits::max();
  return static_cast<int32_t>(std::clamp<int64_t>(int64Value(), Limits::min(), Limits::max()));
}

double Value::doubleValue() const noexcept {
  switch (type()) {
    case Type::boolean:
      return *boolean() ? 1 : 0;
    case Type::integer:
      return static_cast<double>(*integer());
    case Type::unsignedInteger:
      return static_cast<double>(*unsignedInteger());
    case Type::real:
      return *real();
    case Type::string:
      return leadingReal(*string());
    default:
      return 0;
  }
}

bool Value::boolValue() const noexcept {
  if (type() == Type::real) return *real() != 0;
  const auto* held = string();
  if (held == nullptr) return int64Value() != 0;
  auto text = skipBlanks(*held);
  if (text.starts_with('+') || text.starts_with('-')) text.remove_prefix(1);
  while (text.starts_with('0')) text.remove_prefix(1);
  return !text.empty() && std::string_view("YyTt123456789").find(text.front()) != std::string_view::npos;
}

std::string Value::description() const {
  switch (type()) {
    case Type::null:
      return "(null)";
    case Type::boolean:
      return *boolean() ? "1" : "0";
    case Type::integer:
      return decimal(*integer());
    case Type::unsignedInteger:
      return decimal(*unsignedInteger());
    case Type::real:
      return decimal(*real());
    case Type::date:
      return tarnel::description(*date());
    case Type::string:
      return *string();
    case Type::data:
      return "<" + hexText(*data()) + ">";
    case Type::array:
      return tarnel::description(*array());
    case Type::dictionary:
      return tarnel::description(*dictionary());
  }
  return {};
}

std::string description(const Dictionary& dictionary) {
  std::string out = "{";
  for (const auto& [key, value] : dictionary) {
    if (out.size() > 1) out += ", ";
    appendQuoted(out, key);
    out += ": ";
    appendInside(out, value);
  }
  return out + '}';
}

std::string description(const Array& array) {
  std::string out = "[";
  for (const auto& value : array) {
    if (out.size() > 1) out += ", ";
    appendInside(out, value);
  }
  return out + ']';
}

std::string description(Date date) {
  constexpr double kLastSecondOfYear9999 = 253402300799.0;
  constexpr double kFirstSecondOfYear0 = -62167219200.0;
  if (!(date.seconds >= kFirstSecondOfYear0 && date.seconds <= kLastSecondOfYear9999))
    return decimal(date.seconds);
  const auto whole = static_cast<std::time_t>(std::floor(date.seconds));
  std::tm parts{};
  gmtime_r(&whole, &parts);
  std::array<char, 40> buffer{};
  const auto length = std::strftime(buffer.data(), buffer.size(), "%Y-%m-%d %H:%M:%S +0000", &parts);
  return {buffer.data(), length};
}

std::string_view writeReal(double number, std::span<char, kRealTextSize> buffer) noexcept {
  // Digits all the way where people would write them so; std::to_chars alone turns 100000 into 1e+05.
  const double magnitude = std::fabs(number);
  const bool plain = magnitude == 0 || (magnitude >= 1e-5 && magnitude < 1e17);
  char* const first = buffer.data();
  const auto [end, error] =
      plain ? std::to_chars(first, first + buffer.size(), number, std::chars_format::fixed)
            : std::to_chars(first, first + buffer.size(), number);
  return {first, error == std::errc{} ? static_cast<size_t>(end - first) : 0};
}

double finiteOrMinusOne(double value) noexcept {
  return std::isfinite(value) ? value : -1.0;
}

}  // namespace tarnel
