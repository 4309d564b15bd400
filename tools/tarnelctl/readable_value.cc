#include "tools/tarnelctl/readable_value.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <span>
#include <string_view>

#include "base/hex.h"
#include "base/rfc3339.h"

namespace tarnel::ctl {
namespace {

constexpr size_t kShownBytes = 64;  // of data
constexpr size_t kIndent = 2;

// The length of a sequence that begins with this byte, in text that is UTF-8.
size_t sequenceLength(unsigned char first) {
  if (first < 0xC0) return 1;
  if (first < 0xE0) return 2;
  return first < 0xF0 ? 3 : 4;
}

uint32_t codePoint(std::string_view sequence) {
  constexpr std::array<uint32_t, 5> kFirstBits{0, 0x7F, 0x1F, 0x0F, 0x07};
  uint32_t point = static_cast<unsigned char>(sequence.front()) & kFirstBits[sequence.size()];
  for (const char byte : sequence.substr(1)) point = point << 6U | (static_cast<unsigned char>(byte) & 0x3FU);
  return point;
}

// What a terminal obeys, or takes for another order of the letters or another line.
bool isInvisible(uint32_t point) {
  return point < 0x20 || (point >= 0x7F && point < 0xA0) || point == 0x61C || point == 0x200E ||
         point == 0x200F || (point >= 0x2028 && point <= 0x202E) || (point >= 0x2066 && point <= 0x2069);
}

void appendQuoted(std::string& out, std::string_view text) {
  out += '"';
  while (!text.empty()) {
    const auto sequence = text.substr(0, sequenceLength(static_cast<unsigned char>(text.front())));
    text.remove_prefix(sequence.size());
    const uint32_t point = codePoint(sequence);
    if (point == '\n') {
      out += "\\n";
    } else if (point == '\t') {
      out += "\\t";
    } else if (isInvisible(point)) {
      std::array<char, 16> escape{};
      std::snprintf(escape.data(), escape.size(), "\\u%04x", point);
      out += escape.data();
    } else {
      if (point == '"' || point == '\\') out += '\\';
      out += sequence;
    }
  }
  out += '"';
}

// Plain where that cannot be taken for anything else.
void appendKey(std::string& out, const std::string& key) {
  const auto isPlain = [](char letter) {
    return (letter >= 'a' && letter <= 'z') || (letter >= 'A' && letter <= 'Z') ||
           (letter >= '0' && letter <= '9') || letter == '_' || letter == '-' || letter == '.' ||
           letter == '$';
  };
  if (!key.empty() && key.front() != '-' && std::all_of(key.begin(), key.end(), isPlain)) {
    out += key;
  } else {
    appendQuoted(out, key);
  }
  out += ':';
}

void appendData(std::string& out, const Data& data) {
  out += '<' + std::to_string(data.size()) + (data.size() == 1 ? " byte" : " bytes");
  if (!data.empty()) out += ": ";
  out += hexText(std::span(data).first(std::min(data.size(), kShownBytes)));
  out += data.size() > kShownBytes ? "...>" : ">";
}

bool hasLines(const Value& value) {
  return (value.array() != nullptr && !value.array()->empty()) ||
         (value.dictionary() != nullptr && !value.dictionary()->empty());
}

void appendScalar(std::string& out, const Value& value) {
  if (const auto* text = value.string()) {
    appendQuoted(out, *text);
  } else if (const auto* data = value.data()) {
    appendData(out, *data);
  } else if (const auto* date = value.date()) {
    out += rfc3339Text(*date).value_or("date " + Value(date->seconds).description() + " s after 1970");
  } else if (const auto* boolean = value.boolean()) {
    out += *boolean ? "true" : "false";
  } else if (value.array() != nullptr) {
    out += "[]";
  } else if (value.dictionary() != nullptr) {
    out += "{}";
  } else {
    out += value.isNull() ? "null" : value.description();
  }
}

// The first line continues the one that `out` ends with; the nesting is bounded where the value was read.
void appendLines(std::string& out, const Value& value, size_t depth) {
  const std::string indent(depth * kIndent, ' ');
  bool isFirst = true;
  const auto beginLine = [&out, &indent, &isFirst] {
    if (!isFirst) out += indent;
    isFirst = false;
  };
  if (!hasLines(value)) {
    appendScalar(out, value);
    out += '\n';
  } else if (const auto* array = value.array()) {
    for (const Value& element : *array) {
      beginLine();
      out += "- ";
      appendLines(out, element, depth + 1);
    }
  } else {
    for (const auto& [key, entry] : *value.dictionary()) {
      beginLine();
      appendKey(out, key);
      out += hasLines(entry) ? '\n' + indent + std::string(kIndent, ' ') : " ";
      appendLines(out, entry, depth + 1);
    }
  }
}

}  // namespace

std::string readableText(const Value& value) {
  std::string out;
  appendLines(out, value, 0);
  return out;
}

}  // namespace tarnel::ctl
