#include <array>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdio>

#include "formats/toml.h"

namespace tarnel {

namespace {

constexpr int kMaxDepth = 32;

// Writes values to the end of a text; false when one cannot stand in TOML.
class Writer {
 public:
  explicit Writer(std::string& out) : out_(out) {}

  bool writeText(std::string_view text) {
    if (!isValidUtf8(text)) return false;
    out_ += '"';
    for (const char character : text) writeCharacter(character);
    out_ += '"';
    return true;
  }

  bool writeValue(const Value& value, int depth) {
    switch (value.type()) {
      case Value::Type::boolean:
        out_ += *value.boolean() ? "true" : "false";
        return true;
      case Value::Type::integer:
        out_ += std::to_string(*value.integer());
        return true;
      case Value::Type::real:
        writeReal(*value.real());
        return true;
      case Value::Type::date:
        return writeDate(*value.date());
      case Value::Type::string:
        return writeText(*value.string());
      case Value::Type::array:
        return depth < kMaxDepth && writeArray(*value.array(), depth + 1);
      case Value::Type::dictionary:
        return depth < kMaxDepth && writeTable(*value.dictionary(), depth + 1);
      case Value::Type::null:
      case Value::Type::unsignedInteger:
      case Value::Type::data:
        return false;
    }
    return false;
  }

 private:
  void writeCharacter(char character) {
    const auto code = static_cast<unsigned char>(character);
    if (character == '"' || character == '\\') {
      out_ += '\\';
      out_ += character;
    } else if (code < 0x20 || code == 0x7F) {
      std::array<char, 8> escape{};
      std::snprintf(escape.data(), escape.size(), "\\u%04X", code);
      out_ += escape.data();
    } else {
      out_ += character;
    }
  }

  // A real is told from an integer by its point or exponent.
  void writeReal(double number) {
    if (std::isnan(number)) {
      out_ += "nan";
      return;
    }
    if (std::isinf(number)) {
      out_ += number < 0 ? "-inf" : "inf";
      return;
    }
    std::array<char, 32> digits{};
    const auto end = std::to_chars(digits.data(), digits.data() + digits.size(), number).ptr;
    const std::string_view text(digits.data(), static_cast<size_t>(end - digits.data()));
    out_ += text;
    if (text.find_first_of(".e") == std::string_view::npos) out_ += ".0";
  }

  // To the microsecond, in UTC.
  bool writeDate(Date date) {
    using std::chrono::microseconds;
    constexpr double kYear0 = -62167219200.0;
    constexpr double kYear10000 = 253402300800.0;
    if (!(date.seconds >= kYear0 && date.seconds < kYear10000 - 1e-3)) return false;
    const microseconds since(std::llround(date.seconds * 1e6));
    const std::chrono::sys_time<microseconds> moment(since);
    const auto day = std::chrono::floor<std::chrono::days>(moment);
    const std::chrono::year_month_day calendar(day);
    const std::chrono::hh_mm_ss<microseconds> clock(moment - day);
    std::array<char, 48> text{};
    std::snprintf(text.data(), text.size(), "%04d-%02u-%02uT%02d:%02d:%02d.%06dZ",
                  static_cast<int>(calendar.year()), static_cast<unsigned>(calendar.month()),
                  static_cast<unsigned>(calendar.day()), static_cast<int>(clock.hours().count()),
                  static_cast<int>(clock.minutes().count()), static_cast<int>(clock.seconds().count()),
                  static_cast<int>(clock.subseconds().count()));
    out_ += text.data();
    return true;
  }

  bool writeArray(const Array& array, int depth) {
    out_ += '[';
    for (size_t index = 0; index < array.size(); ++index) {
      if (index != 0) out_ += ", ";
      if (!writeValue(array[index], depth)) return false;
    }
    out_ += ']';
    return true;
  }

  bool writeTable(const Dictionary& dictionary, int depth) {
    out_ += '{';
    bool first = true;
    for (const auto& [key, value] : dictionary) {
      out_ += first ? " " : ", ";
      first = false;
      if (!writeText(key)) return false;
      out_ += " = ";
      if (!writeValue(value, depth)) return false;
    }
    out_ += first ? "}" : " }";
    return true;
  }

  std::string& out_;
};

}  // namespace

Result<std::string> writeToml(const Dictionary& entries) {
  std::string out;
  Writer writer(out);
  for (const auto& [key, value] : entries) {
    const bool keyWritten = writer.writeText(key);
    out += " = ";
    if (!keyWritten || !writer.writeValue(value, 0)) {
      return Error(
          kTomlErrorDomain, 0,
          "the value of \"" + key +
              "\" cannot be stored: only booleans, signed 64-bit integers, reals, UTF-8 texts, dates "
              "and arrays and dictionaries of them can");
    }
    out += '\n';
  }
  return out;
}

}  // namespace tarnel
