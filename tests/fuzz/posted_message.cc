#include "tests/fuzz/posted_message.h"

#include <zlib.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <cstdlib>

#include "tests/fuzz/fuzz_target.h"

namespace tarnel::fuzz {
namespace {

class JsonReader {
 public:
  explicit JsonReader(std::string_view text) : rest_(text) {}

  std::optional<Value> whole() {
    auto value = read(0);
    skipBlanks();
    if (!rest_.empty()) return std::nullopt;
    return value;
  }

 private:
  static constexpr int kDeepest = 40;

  void skipBlanks() { rest_.remove_prefix(std::min(rest_.find_first_not_of(" \t\r\n"), rest_.size())); }
  bool take(std::string_view token) {
    skipBlanks();
    if (!rest_.starts_with(token)) return false;
    rest_.remove_prefix(token.size());
    return true;
  }

  std::optional<Value> read(int depth) {
    if (depth > kDeepest) return std::nullopt;
    if (take("{")) return readObject(depth);
    if (take("[")) return readArray(depth);
    if (take("\"")) return readText();
    if (take("null")) return Value();
    if (take("true")) return Value(true);
    if (take("false")) return Value(false);
    return readNumber();
  }

  std::optional<Value> readObject(int depth) {
    Dictionary object;
    if (take("}")) return Value(object);
    do {
      if (!take("\"")) return std::nullopt;
      const auto key = readText();
      if (!key || !take(":")) return std::nullopt;
      auto value = read(depth + 1);
      if (!value || object.contains(*key->string())) return std::nullopt;
      object.set(*key->string(), *std::move(value));
    } while (take(","));
    return take("}") ? std::optional<Value>(std::move(object)) : std::nullopt;
  }

  std::optional<Value> readArray(int depth) {
    Array array;
    if (take("]")) return Value(array);
    do {
      auto value = read(depth + 1);
      if (!value) return std::nullopt;
      array.append(*std::move(value));
    } while (take(","));
    return take("]") ? std::optional<Value>(std::move(array)) : std::nullopt;
  }

  std::optional<Value> readText() {
    std::string text;
    while (!rest_.empty() && rest_.front() != '"') {
      const auto isPlain = [](char c) {
        return c != '"' && c != '\\' && static_cast<unsigned char>(c) >= 0x20;
      };
      const auto plain = std::find_if_not(rest_.begin(), rest_.end(), isPlain);
      text.append(rest_.begin(), plain);
      rest_.remove_prefix(static_cast<size_t>(plain - rest_.begin()));
      if (rest_.empty() || rest_.front() == '"') break;
      const char c = rest_.front();
      if (static_cast<unsigned char>(c) < 0x20) return std::nullopt;
      rest_.remove_prefix(1);
      if (!readEscape(text)) return std::nullopt;
    }
    if (rest_.empty() || !isValidUtf8(text)) return std::nullopt;
    rest_.remove_prefix(1);
    return Value(std::move(text));
  }

  bool readEscape(std::string& text) {
    constexpr std::string_view kNames = "\"\\/bfnrt";
    constexpr std::string_view kMeanings = "\"\\/\b\f\n\r\t";
    if (rest_.empty()) return false;
    const char name = rest_.front();
    rest_.remove_prefix(1);
    if (const auto which = kNames.find(name); which != std::string_view::npos) {
      text += kMeanings[which];
      return true;
    }
    if (name != 'u') return false;
    auto unit = hexUnit();
    if (!unit || (*unit >= 0xDC00 && *unit < 0xE000)) return false;
    if (*unit < 0xD800 || *unit >= 0xE000) return appendCharacter(text, *unit);
    if (!rest_.starts_with("\\u")) return false;
    rest_.remove_prefix(2);
    const auto low = hexUnit();
    if (!low || *low < 0xDC00 || *low >= 0xE000) return false;
    return appendCharacter(text, 0x10000 + ((*unit - 0xD800) << 10U) + (*low - 0xDC00));
  }

  std::optional<uint32_t> hexUnit() {
    uint32_t unit = 0;
    if (rest_.size() < 4) return std::nullopt;
    const auto [end, error] = std::from_chars(rest_.data(), rest_.data() + 4, unit, 16);
    if (error != std::errc() || end != rest_.data() + 4) return std::nullopt;
    rest_.remove_prefix(4);
    return unit;
  }

  static bool appendCharacter(std::string& text, uint32_t c) {
    if (c < 0x80) {
      text += static_cast<char>(c);
    } else if (c < 0x800) {
      text += {static_cast<char>(0xC0 | c >> 6), static_cast<char>(0x80 | (c & 0x3F))};
    } else if (c < 0x10000) {
      text += {static_cast<char>(0xE0 | c >> 12), static_cast<char>(0x80 | (c >> 6 & 0x3F)),
               static_cast<char>(0x80 | (c & 0x3F))};
    } else {
      text += {static_cast<char>(0xF0 | c >> 18), static_cast<char>(0x80 | (c >> 12 & 0x3F)),
               static_cast<char>(0x80 | (c >> 6 & 0x3F)), static_cast<char>(0x80 | (c & 0x3F))};
    }
    return true;
  }

  // -? (0 | [1-9][0-9]*) (. [0-9]+)? ([eE] [+-]? [0-9]+)?
  std::optional<Value> readNumber() {
    size_t at = rest_.starts_with('-') ? 1 : 0;
    const auto digits = [this, &at] {
      const size_t from = at;
      while (at < rest_.size() && rest_[at] >= '0' && rest_[at] <= '9') ++at;
      return at - from;
    };
    const size_t first = at;
    const size_t whole = digits();
    if (whole == 0 || (whole > 1 && rest_[first] == '0')) return std::nullopt;
    bool isWhole = true;
    if (at < rest_.size() && rest_[at] == '.') {
      ++at;
      isWhole = false;
      if (digits() == 0) return std::nullopt;
    }
    if (at < rest_.size() && (rest_[at] == 'e' || rest_[at] == 'E')) {
      ++at;
      isWhole = false;
      if (at < rest_.size() && (rest_[at] == '+' || rest_[at] == '-')) ++at;
      if (digits() == 0) return std::nullopt;
    }
    const std::string token(rest_.substr(0, at));
    rest_.remove_prefix(at);
    if (isWhole) {
      int64_t number = 0;
      if (std::from_chars(token.data(), token.data() + token.size(), number).ec == std::errc()) return number;
    }
    return Value(std::strtod(token.c_str(), nullptr));
  }

  std::string_view rest_;
};

std::string inflated(const std::string& gzip) {
  z_stream stream{};
  require(inflateInit2(&stream, 15 + 16) == Z_OK, "zlib has memory");
  std::string input = gzip;
  stream.next_in = reinterpret_cast<Bytef*>(input.data());
  stream.avail_in = static_cast<uInt>(input.size());
  std::string out;
  std::array<char, 16384> piece{};
  int result = Z_OK;
  while (result == Z_OK) {
    stream.next_out = reinterpret_cast<Bytef*>(piece.data());
    stream.avail_out = static_cast<uInt>(piece.size());
    result = inflate(&stream, Z_NO_FLUSH);
    out.append(piece.data(), piece.size() - stream.avail_out);
  }
  inflateEnd(&stream);
  require(result == Z_STREAM_END, "a compressed body can be uncompressed");
  return out;
}

void examineHeaders(const HttpRequest& request) {
  constexpr size_t kLongest = 1024;
  for (const auto& header : request.headers) {
    require(header.value.size() <= kLongest, "a header's value is bounded");
    const bool isFit = std::none_of(header.value.begin(), header.value.end(), [](char c) {
      const auto byte = static_cast<unsigned char>(c);
      return (byte < 0x20 && c != '\t') || byte == 0x7F;
    });
    require(isFit, "a header's value holds no control characters");
  }
  require(headerValue(request, "Content-Length") == std::to_string(request.body->size()),
          "Content-Length is that of the body");
}

}  // namespace

std::optional<Value> readJson(std::string_view text) {
  return JsonReader(text).whole();
}

std::optional<std::string> headerValue(const HttpRequest& request, std::string_view name) {
  for (const auto& header : request.headers) {
    if (header.name == name) return header.value;
  }
  return std::nullopt;
}

std::string bodyOf(const HttpRequest& request) {
  require(request.body != nullptr, "a post has a body");
  return headerValue(request, "Content-Encoding") ? inflated(*request.body) : *request.body;
}

Array eventsOf(const Dictionary& message) {
  const auto* events = findArray(message, "events");
  return events == nullptr ? Array() : *events;
}

std::optional<Dictionary> readPostedMessage(const HttpRequest& request) {
  if (headerValue(request, "Content-Type") != "application/json") return std::nullopt;
  require(request.method == "POST", "a message is posted");
  const auto body = bodyOf(request);
  examineHeaders(request);
  const auto message = readJson(body);
  require(message && message->dictionary() != nullptr, "a message is one JSON object");
  require(findNumber(*message->dictionary(), "postTime") != nullptr, "a message has its time");
  for (const auto& event : eventsOf(*message->dictionary())) {
    require(event.dictionary() != nullptr, "an event is an object");
    for (const auto& [key, value] : *event.dictionary()) {
      require(value.isNumber() || value.string() != nullptr, "an event holds texts and numbers only");
    }
  }
  return *message->dictionary();
}

}  // namespace tarnel::fuzz
