#pragma once

#include <array>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <limits>
#include <string_view>

#if defined(__SSE2__)
#include <emmintrin.h>
#endif
#include <rapidjson/prettywriter.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include "base/value.h"

#if defined(__SSE2__)
#if defined(RAPIDJSON_SIMD)
#error "RapidJSON's own block-wise code leaves the characters 0x1A to 0x1F unescaped; do without it"
#endif
namespace rapidjson {

// Copies blocks of characters that need no escape at once; what is left is told to the caller one by one.
template <>
inline bool Writer<StringBuffer>::ScanWriteUnescapedString(StringStream& is, size_t length) {
  constexpr size_t kBlock = 16;
  const char* const end = is.head_ + length;
  const __m128i quote = _mm_set1_epi8('"');
  const __m128i backslash = _mm_set1_epi8('\\');
  const __m128i lastControl = _mm_set1_epi8(0x1F);
  while (static_cast<size_t>(end - is.src_) >= kBlock) {
    const __m128i block = _mm_loadu_si128(reinterpret_cast<const __m128i*>(is.src_));
    const __m128i control = _mm_cmpeq_epi8(_mm_max_epu8(block, lastControl), lastControl);
    const __m128i special =
        _mm_or_si128(_mm_or_si128(_mm_cmpeq_epi8(block, quote), _mm_cmpeq_epi8(block, backslash)), control);
    const auto mask = static_cast<unsigned>(_mm_movemask_epi8(special));
    const size_t plain = mask == 0 ? kBlock : static_cast<size_t>(__builtin_ctz(mask));
    std::memcpy(os_->PushUnsafe(plain), is.src_, plain);
    is.src_ += plain;
    if (mask != 0) break;
  }
  return is.Tell() < length;
}

}  // namespace rapidjson
#endif

namespace tarnel::detail {

// A finite double in JSON: the shortest text that reads back as the same double, with ".0" when whole.
template <class Writer>
bool emitReal(Writer& writer, double number) {
  std::array<char, kRealTextSize + 2> buffer;  // filled as far as it is used
  char* const first = buffer.data();
  size_t length = 0;
  bool plain = true;
  if (std::fabs(number) < 1e15 && std::trunc(number) == number && !(number == 0 && std::signbit(number))) {
    // Much cheaper than the search for the shortest digits, and most doubles are whole.
    const auto end = std::to_chars(first, first + kRealTextSize, static_cast<int64_t>(number)).ptr;
    length = static_cast<size_t>(end - first);
  } else {
    const auto text = writeReal(number, std::span<char, kRealTextSize>(first, kRealTextSize));
    length = text.size();
    plain = text.find_first_of(".e") == std::string_view::npos;
  }
  if (plain) {
    first[length++] = '.';
    first[length++] = '0';
  }
  return writer.RawValue(first, length, rapidjson::kNumberType);
}

inline rapidjson::SizeType sizeOf(std::string_view text) {
  return static_cast<rapidjson::SizeType>(text.size());
}

inline bool fits(std::string_view text) {
  return text.size() <= std::numeric_limits<rapidjson::SizeType>::max();
}

// Walks a value into a RapidJSON writer. Leaves says how to write what JSON has no word for: text(), real(),
// date() and data(), each returning false to give up; key() is text() for keys.
template <class Writer, class Leaves>
class JsonEmitter {
 public:
  JsonEmitter(Writer& writer, Leaves& leaves) : writer_(writer), leaves_(leaves) {}

  bool emit(const Value& value) {
    switch (value.type()) {
      case Value::Type::null:
        return writer_.Null();
      case Value::Type::boolean:
        return writer_.Bool(*value.boolean());
      case Value::Type::integer:
        return writer_.Int64(*value.integer());
      case Value::Type::unsignedInteger:
        return writer_.Uint64(*value.unsignedInteger());
      case Value::Type::real:
        return leaves_.real(writer_, *value.real());
      case Value::Type::date:
        return leaves_.date(writer_, *value.date());
      case Value::Type::string:
        return leaves_.text(writer_, *value.string());
      case Value::Type::data:
        return leaves_.data(writer_, *value.data());
      case Value::Type::array:
        return emit(*value.array());
      case Value::Type::dictionary:
        return emit(*value.dictionary());
    }
    return false;
  }

  bool emit(const Dictionary& dictionary) {
    if (!writer_.StartObject()) return false;
    for (const auto& [key, value] : dictionary) {
      if (!leaves_.key(writer_, key) || !emit(value)) return false;
    }
    return writer_.EndObject();
  }

  bool emit(const Array& array) {
    if (!writer_.StartArray()) return false;
    for (const auto& value : array) {
      if (!emit(value)) return false;
    }
    return writer_.EndArray();
  }

 private:
  Writer& writer_;
  Leaves& leaves_;
};

}  // namespace tarnel::detail
