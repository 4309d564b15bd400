#include "tools/receiving/text.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <ctime>

#include "base/utf8.h"
#include "base/value.h"

namespace tarnel::lab {
namespace {

constexpr std::array<const char*, 7> kDays = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
constexpr std::array<const char*, 12> kMonths = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                                 "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};

template <class... Args>
std::string formatted(const char* format, Args... args) {
  std::array<char, 96> buffer{};
  const int size = std::snprintf(buffer.data(), buffer.size(), format, args...);
  return std::string(buffer.data(), std::min(static_cast<size_t>(std::max(size, 0)), buffer.size() - 1));
}

bool isControl(std::string_view character) {
  const auto first = static_cast<unsigned char>(character[0]);
  if (character.size() == 1) return first < 0x20 || first == 0x7f;
  const auto second = static_cast<unsigned char>(character[1]);
  if (character.size() == 2) return first == 0xc2 && second < 0xa0;  // C1
  // Marks that turn the direction of writing, and line separators.
  if (character.size() != 3 || first != 0xe2) return false;
  const auto third = static_cast<unsigned char>(character[2]);
  return (second == 0x80 && (third == 0x8e || third == 0x8f || (third >= 0xa8 && third <= 0xae))) ||
         (second == 0x81 && third >= 0xa6 && third <= 0xa9);
}

}  // namespace

std::string printable(std::string_view text, size_t maxBytes) {
  std::string shown;
  while (!text.empty()) {
    const size_t size = utf8CharacterLength(text);
    const std::string_view character = text.substr(0, std::max<size_t>(size, 1));
    if (shown.size() + character.size() > maxBytes) return shown + "...";
    shown += size == 0 || isControl(character) ? "?" : character;
    text.remove_prefix(character.size());
  }
  return shown;
}

std::string grouped(uint64_t number) {
  std::string digits = std::to_string(number);
  for (size_t i = digits.size(); i > 3; i -= 3) digits.insert(i - 3, ",");
  return digits;
}

std::string byteCount(uint64_t bytes) {
  if (bytes < 1000) return formatted("%u B", static_cast<unsigned int>(bytes));
  if (bytes < 999'950) return formatted("%.1f kB", static_cast<double>(bytes) / 1e3);
  return formatted("%.1f MB", static_cast<double>(bytes) / 1e6);
}

std::string clockTime(double seconds) {
  const double whole = std::floor(seconds);
  const std::time_t time = static_cast<std::time_t>(whole);
  std::tm local{};
  ::localtime_r(&time, &local);
  return formatted("%02d:%02d:%02d.%03d", local.tm_hour, local.tm_min, local.tm_sec,
                   static_cast<int>((seconds - whole) * 1000));
}

std::string lowerCased(std::string_view text) {
  std::string lower(text);
  for (char& letter : lower) {
    if (letter >= 'A' && letter <= 'Z') letter = static_cast<char>(letter - 'A' + 'a');
  }
  return lower;
}

std::string httpDate(int64_t seconds) {
  const std::time_t time = seconds;
  std::tm utc{};
  ::gmtime_r(&time, &utc);
  return formatted("%s, %02d %s %04d %02d:%02d:%02d GMT", kDays.at(static_cast<size_t>(utc.tm_wday)),
                   utc.tm_mday, kMonths.at(static_cast<size_t>(utc.tm_mon)), utc.tm_year + 1900, utc.tm_hour,
                   utc.tm_min, utc.tm_sec);
}

std::optional<int64_t> parseHttpDate(std::string_view text) {
  std::tm utc{};
  std::array<char, 4> day{};
  std::array<char, 4> month{};
  int end = 0;
  const std::string copy(text.substr(0, 64));
  const int fields =
      std::sscanf(copy.c_str(), "%3[A-Za-z], %2d %3[A-Za-z] %4d %2d:%2d:%2d GMT%n", day.data(), &utc.tm_mday,
                  month.data(), &utc.tm_year, &utc.tm_hour, &utc.tm_min, &utc.tm_sec, &end);
  if (fields != 7 || end == 0 || static_cast<size_t>(end) != text.size()) return std::nullopt;
  const auto name = std::find_if(kMonths.begin(), kMonths.end(), [&month](const char* candidate) {
    return month.data() == std::string_view(candidate);
  });
  if (name == kMonths.end()) return std::nullopt;
  utc.tm_mon = static_cast<int>(name - kMonths.begin());
  utc.tm_year -= 1900;
  const int64_t seconds = ::timegm(&utc);
  // A day that the calendar does not have would have been carried over; the text must come back.
  return httpDate(seconds).substr(5) == text.substr(5) ? std::optional(seconds) : std::nullopt;
}

std::optional<uint64_t> parseNumber(std::string_view text) {
  uint64_t number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return number;
}

size_t lineOfOffset(std::string_view text, size_t offset) {
  return 1 + static_cast<size_t>(std::count(
                 text.begin(), text.begin() + static_cast<ptrdiff_t>(std::min(offset, text.size())), '\n'));
}

}  // namespace tarnel::lab
