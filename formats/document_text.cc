#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

#include "base/rfc3339.h"
#include "formats/cryptography.h"
#include "formats/document.h"
#include "formats/document_builder.h"
#include "formats/json_emitter.h"

#include <rapidjson/error/en.h>
#include <rapidjson/memorystream.h>
#include <rapidjson/reader.h>

namespace tarnel {
namespace {

constexpr std::string_view kDateKey = "$date";
constexpr std::string_view kDataKey = "$data";

// Whether a number that no double holds is too large, as opposed to too close to zero.
bool isTooLarge(std::string_view number) {
  const size_t end = std::min(number.find_first_of("eE"), number.size());
  const std::string_view digits = number.substr(0, end);
  const size_t point = std::min(digits.find('.'), digits.size());
  const size_t first = digits.find_first_of("123456789");  // not being zero, it has one
  std::string_view exponent = number.substr(std::min(end + 1, number.size()));
  const bool isNegative = exponent.starts_with('-');
  if (isNegative || exponent.starts_with('+')) exponent.remove_prefix(1);
  uint32_t power = 0;
  const auto result = std::from_chars(exponent.data(), exponent.data() + exponent.size(), power);
  if (result.ec == std::errc::result_out_of_range) power = std::numeric_limits<uint32_t>::max();
  const auto place = static_cast<int64_t>(point) - static_cast<int64_t>(first);
  return place + (isNegative ? -int64_t{power} : int64_t{power}) > 0;
}

// A number in JSON's own notation; nothing when no double is as large.
std::optional<Value> numberOf(std::string_view text) {
  const char* const end = text.data() + text.size();
  if (text.find_first_of(".eE") == std::string_view::npos) {
    int64_t number = 0;
    if (std::from_chars(text.data(), end, number).ec == std::errc()) return number;
    uint64_t large = 0;
    if (std::from_chars(text.data(), end, large).ec == std::errc()) return large;
  }
  double real = 0;
  if (std::from_chars(text.data(), end, real).ec == std::errc()) return real;
  if (isTooLarge(text)) return std::nullopt;
  return text.starts_with('-') ? -0.0 : 0.0;
}

// What the reader calls for every item of the text; false ends the reading.
class TextHandler {
 public:
  explicit TextHandler(detail::DocumentBuilder& builder) : builder_(builder) {}

  bool Null() { return builder_.add(Value()); }
  bool Bool(bool value) { return builder_.add(value); }
  // Never called: numbers come as their texts.
  bool Int(int) { return false; }
  bool Uint(unsigned) { return false; }
  bool Int64(int64_t) { return false; }
  bool Uint64(uint64_t) { return false; }
  bool Double(double) { return false; }
  bool RawNumber(const char* text, rapidjson::SizeType length, bool) {
    auto number = numberOf({text, length});
    if (!number) return builder_.fail(kDocumentMalformed, "Number too big to be stored in double");
    return builder_.add(*std::move(number));
  }
  bool String(const char* text, rapidjson::SizeType length, bool) {
    return builder_.add(std::string(text, length));
  }
  bool Key(const char* text, rapidjson::SizeType length, bool) {
    return builder_.key(std::string(text, length));
  }
  bool StartObject() { return builder_.openDictionary(); }
  bool StartArray() { return builder_.openArray(); }
  bool EndArray(rapidjson::SizeType) {
    return builder_.close([](Value&) { return true; });
  }
  bool EndObject(rapidjson::SizeType) {
    return builder_.close([this](Value& value) { return convert(value); });
  }

 private:
  bool convert(Value& value) {
    const Dictionary& dictionary = *value.dictionary();
    if (dictionary.size() != 1) return true;
    const auto& [key, held] = *dictionary.begin();
    const auto* text = held.string();
    if (key == kDateKey) {
      const auto date = text == nullptr ? std::nullopt : parseRfc3339(*text);
      if (!date) return builder_.fail(kDocumentMalformed, "a \"$date\" that is no RFC 3339 time");
      value = *date;
    } else if (key == kDataKey) {
      auto data = text == nullptr ? std::nullopt : base64Decode(*text);
      if (!data) return builder_.fail(kDocumentMalformed, "a \"$data\" that is no base-64 text");
      value = std::move(*data);
    }
    return true;
  }

  detail::DocumentBuilder& builder_;
};

// Well-formed characters as they are, every other byte as U+FFFD.
std::string repairedUtf8(std::string_view text) {
  std::string out;
  while (!text.empty()) {
    const size_t length = utf8CharacterLength(text);
    out += length == 0 ? "\xEF\xBF\xBD" : text.substr(0, length);
    text.remove_prefix(length == 0 ? 1 : length);
  }
  return out;
}

struct DocumentLeaves {
  template <class Writer>
  bool string(Writer& writer, std::string_view text) {
    return detail::fits(text) ? writer.String(text.data(), detail::sizeOf(text)) : writer.Null();
  }
  template <class Writer>
  bool text(Writer& writer, const std::string& text) {
    return isValidUtf8(text) ? string(writer, text) : string(writer, repairedUtf8(text));
  }
  template <class Writer>
  bool key(Writer& writer, const std::string& key) {
    return text(writer, key);
  }
  template <class Writer>
  bool real(Writer& writer, double number) {
    return std::isfinite(number) ? detail::emitReal(writer, number) : writer.Null();
  }
  template <class Writer>
  bool date(Writer& writer, Date date) {
    const auto time = rfc3339Text(date);
    return time ? single(writer, kDateKey, *time) : writer.Null();
  }
  template <class Writer>
  bool data(Writer& writer, const Data& data) {
    return single(writer, kDataKey, base64Encode(data));
  }
  template <class Writer>
  bool single(Writer& writer, std::string_view key, std::string_view text) {
    return writer.StartObject() && string(writer, key) && string(writer, text) && writer.EndObject();
  }
};

template <class Writer>
void emitDocument(Writer& writer, const Value& value) {
  DocumentLeaves leaves;
  detail::JsonEmitter<Writer, DocumentLeaves>(writer, leaves).emit(value);
}

}  // namespace

namespace detail {

Result<Value> parseTextDocument(std::string_view bytes, const DocumentLimits& limits) {
  constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";
  const size_t skipped = bytes.starts_with(kByteOrderMark) ? kByteOrderMark.size() : 0;
  rapidjson::MemoryStream stream(bytes.data() + skipped, bytes.size() - skipped);
  rapidjson::Reader reader;
  DocumentBuilder builder(limits);
  TextHandler handler(builder);
  // Numbers are read here: the library makes large ones of 0e308 and 1.8e308.
  constexpr unsigned kFlags = rapidjson::kParseIterativeFlag | rapidjson::kParseNumbersAsStringsFlag;
  const auto result = reader.Parse<kFlags>(stream, handler);
  if (result.IsError()) {
    if (!builder.failed()) {
      std::string_view reason = rapidjson::GetParseError_En(result.Code());
      if (reason.ends_with('.')) reason.remove_suffix(1);  // the place follows
      builder.fail(kDocumentMalformed, std::string(reason));
    }
    return builder.error(skipped + result.Offset());
  }
  // The reader takes a NUL for the end of the text.
  if (stream.Tell() != bytes.size() - skipped) {
    builder.fail(kDocumentMalformed, "bytes after the document");
    return builder.error(skipped + stream.Tell());
  }
  return builder.take();
}

}  // namespace detail

std::string writeTextDocument(const Value& value, bool pretty) {
  rapidjson::StringBuffer buffer;
  if (pretty) {
    rapidjson::PrettyWriter<rapidjson::StringBuffer> writer(buffer);
    writer.SetIndent(' ', 2);
    emitDocument(writer, value);
  } else {
    rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
    emitDocument(writer, value);
  }
  return {buffer.GetString(), buffer.GetSize()};
}

}  // namespace tarnel
