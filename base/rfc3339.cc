#include "base/rfc3339.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <system_error>

namespace tarnel {
namespace {

constexpr size_t kMostFractionDigits = 340;  // the smallest double has 324

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

// Reads from the front of a text; one failure makes every later answer meaningless and ok() false.
class Scanner {
 public:
  explicit Scanner(std::string_view text) : rest_(text) {}

  int number(size_t digits) {
    int value = 0;
    if (rest_.size() < digits ||
        !std::all_of(rest_.begin(), rest_.begin() + static_cast<long>(digits), isDigit)) {
      ok_ = false;
      return 0;
    }
    for (size_t i = 0; i < digits; ++i) value = value * 10 + (rest_[i] - '0');
    rest_.remove_prefix(digits);
    return value;
  }
  bool accept(std::string_view anyOf) {
    if (rest_.empty() || anyOf.find(rest_.front()) == std::string_view::npos) return false;
    last_ = rest_.front();
    rest_.remove_prefix(1);
    return true;
  }
  void expect(std::string_view anyOf) { ok_ = accept(anyOf) && ok_; }
  std::string_view digits() {
    const auto end = std::find_if_not(rest_.begin(), rest_.end(), isDigit);
    const auto found = rest_.substr(0, static_cast<size_t>(end - rest_.begin()));
    rest_.remove_prefix(found.size());
    if (found.empty() || found.size() > kMostFractionDigits) ok_ = false;
    return found;
  }
  char last() const { return last_; }
  bool ok() const { return ok_; }
  bool atEnd() const { return rest_.empty(); }

 private:
  std::string_view rest_;
  char last_ = '\0';
  bool ok_ = true;
};

// Digits of 1 - 0.<digits>, at the same length; the digits must not all be zero.
std::string complement(std::string_view digits) {
  std::string out(digits);
  const size_t lastNonZero = out.find_last_not_of('0');
  for (size_t i = 0; i < lastNonZero; ++i) out[i] = static_cast<char>('0' + '9' - out[i]);
  out[lastNonZero] = static_cast<char>('0' + 10 - (out[lastNonZero] - '0'));
  return out;
}

// Whole seconds, rounded down, and the decimal fraction above them, joined without losing a digit.
double joined(int64_t seconds, std::string_view fraction) {
  while (fraction.ends_with('0')) fraction.remove_suffix(1);
  if (fraction.empty()) return static_cast<double>(seconds);
  const std::string text = seconds >= 0 ? std::to_string(seconds) + '.' + std::string(fraction)
                                        : '-' + std::to_string(-(seconds + 1)) + '.' + complement(fraction);
  double result = 0;
  std::from_chars(text.data(), text.data() + text.size(), result);
  return result;
}

}  // namespace

std::optional<Date> parseRfc3339(std::string_view text) {
  Scanner scan(text);
  const int year = scan.number(4);
  scan.expect("-");
  const int month = scan.number(2);
  scan.expect("-");
  const int day = scan.number(2);
  scan.expect("Tt");
  const int hour = scan.number(2);
  scan.expect(":");
  const int minute = scan.number(2);
  scan.expect(":");
  const int second = scan.number(2);
  const std::string_view fraction = scan.accept(".") ? scan.digits() : std::string_view();
  int offset = 0;
  if (scan.accept("+-")) {
    const int sign = scan.last() == '-' ? -1 : 1;
    const int hours = scan.number(2);
    scan.expect(":");
    const int minutes = scan.number(2);
    if (hours > 23 || minutes > 59) return std::nullopt;
    offset = sign * (hours * 3600 + minutes * 60);
  } else {
    scan.expect("Zz");
  }
  const std::chrono::year_month_day date(std::chrono::year(year),
                                         std::chrono::month(static_cast<unsigned>(month)),
                                         std::chrono::day(static_cast<unsigned>(day)));
  if (!scan.ok() || !scan.atEnd() || !date.ok() || hour > 23 || minute > 59 || second > 60)
    return std::nullopt;
  const int64_t days = std::chrono::sys_days(date).time_since_epoch().count();
  return Date{joined(days * 86400 + hour * 3600 + minute * 60 + second - offset, fraction)};
}

std::optional<std::string> rfc3339Text(Date date) {
  constexpr double kFirst = -62167219200.0;  // 0000-01-01T00:00:00Z
  constexpr double kEnd = 253402300800.0;    // 10000-01-01T00:00:00Z
  if (!(date.seconds >= kFirst && date.seconds < kEnd)) return std::nullopt;
  std::array<char, kMostFractionDigits + 20> buffer{};
  const auto [end, error] =
      std::to_chars(buffer.data(), buffer.data() + buffer.size(), date.seconds, std::chars_format::fixed);
  if (error != std::errc{}) return std::nullopt;
  const std::string_view number(buffer.data(), static_cast<size_t>(end - buffer.data()));
  const size_t point = number.find('.');
  std::string fraction(point == std::string_view::npos ? std::string_view() : number.substr(point + 1));
  int64_t whole = 0;
  std::from_chars(number.data(), number.data() + std::min(point, number.size()), whole);
  if (number.starts_with('-') && !fraction.empty()) {
    --whole;
    fraction = complement(fraction);
  }
  const std::chrono::sys_seconds time{std::chrono::seconds(whole)};
  const auto midnight = std::chrono::floor<std::chrono::days>(time);
  const std::chrono::year_month_day day(midnight);
  const auto seconds = static_cast<int>((time - midnight).count());
  std::array<char, 80> text{};
  const int length =
      std::snprintf(text.data(), text.size(), "%04d-%02u-%02uT%02d:%02d:%02d", static_cast<int>(day.year()),
                    static_cast<unsigned>(day.month()), static_cast<unsigned>(day.day()), seconds / 3600,
                    seconds / 60 % 60, seconds % 60);
  std::string out(text.data(), static_cast<size_t>(length));
  if (!fraction.empty()) out += '.' + fraction;
  return out + 'Z';
}

}  // namespace tarnel
