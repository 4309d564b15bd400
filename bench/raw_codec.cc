#include "bench/raw_codec.h"

#include <cstring>
#include <string_view>

namespace tarnel::bench {
namespace {

enum class Tag : uint8_t { boolean, integer, real, string };

void put(Data& out, const void* bytes, size_t size) {
  const auto* first = static_cast<const uint8_t*>(bytes);
  out.insert(out.end(), first, first + size);
}

template <class Number>
void putNumber(Data& out, Number number) {
  put(out, &number, sizeof number);
}

void putText(Data& out, std::string_view text) {
  putNumber(out, static_cast<uint32_t>(text.size()));
  put(out, text.data(), text.size());
}

// Every function returns false when the bytes are used up.
class Cursor {
 public:
  explicit Cursor(std::span<const uint8_t> bytes) : left_(bytes) {}

  template <class Number>
  bool number(Number& out) {
    if (left_.size() < sizeof out) return false;
    std::memcpy(&out, left_.data(), sizeof out);
    left_ = left_.subspan(sizeof out);
    return true;
  }
  bool text(std::string_view& out) {
    uint32_t size = 0;
    if (!number(size) || left_.size() < size) return false;
    out = {reinterpret_cast<const char*>(left_.data()), size};
    left_ = left_.subspan(size);
    return true;
  }
  bool value(Value& out) {
    uint8_t tag = 0;
    if (!number(tag)) return false;
    switch (static_cast<Tag>(tag)) {
      case Tag::boolean: {
        uint8_t held = 0;
        if (!number(held)) return false;
        out = Value(held != 0);
        return true;
      }
      case Tag::integer: {
        int64_t held = 0;
        if (!number(held)) return false;
        out = Value(held);
        return true;
      }
      case Tag::real: {
        double held = 0;
        if (!number(held)) return false;
        out = Value(held);
        return true;
      }
      case Tag::string: {
        std::string_view held;
        if (!text(held)) return false;
        out = Value(held);
        return true;
      }
    }
    return false;
  }

 private:
  std::span<const uint8_t> left_;
};

}  // namespace

Data encodeRaw(const Dictionary& dictionary) {
  Data out;
  putNumber(out, static_cast<uint32_t>(dictionary.size()));
  for (const auto& [key, value] : dictionary) {
    putText(out, key);
    if (const auto* boolean = value.boolean()) {
      putNumber(out, Tag::boolean);
      putNumber(out, static_cast<uint8_t>(*boolean));
    } else if (const auto* integer = value.integer()) {
      putNumber(out, Tag::integer);
      putNumber(out, *integer);
    } else if (const auto* real = value.real()) {
      putNumber(out, Tag::real);
      putNumber(out, *real);
    } else {
      putNumber(out, Tag::string);
      putText(out, value.string() == nullptr ? std::string_view() : std::string_view(*value.string()));
    }
  }
  return out;
}

std::optional<Dictionary> decodeRaw(std::span<const uint8_t> bytes) {
  constexpr uint32_t kMaxEntries = 4096;
  Cursor cursor(bytes);
  uint32_t entries = 0;
  if (!cursor.number(entries) || entries > kMaxEntries) return std::nullopt;
  Dictionary out;
  out.reserve(entries);
  for (uint32_t i = 0; i < entries; ++i) {
    std::string_view key;
    Value value;
    if (!cursor.text(key) || !cursor.value(value)) return std::nullopt;
    out.set(key, std::move(value));
  }
  return out;
}

}  // namespace tarnel::bench
