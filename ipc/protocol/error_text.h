#pragma once

#include <string>
#include <string_view>

#include "base/value.h"

// Pieces of error texts that quote what a peer sent: such a text goes back over the wire and into logs, so
// it must be UTF-8 itself and short.

namespace tarnel::wire {

// The longest part of a key that an error repeats, bytes.
inline constexpr size_t kMaxQuotedKey = 64;

// `key "name"`.
inline std::string quotedKey(std::string_view key) {
  if (!isValidUtf8(key)) return "a key that is not UTF-8";
  size_t length = key.size() <= kMaxQuotedKey ? key.size() : kMaxQuotedKey;
  while (length < key.size() && (static_cast<unsigned char>(key[length]) & 0xC0U) == 0x80) --length;
  return "key \"" + std::string(key.substr(0, length)) + '"';
}

// Puts one more step in front of a place inside nested values.
inline void prependStep(std::string& path, std::string step) {
  if (!path.empty()) step += ", " + path;
  path = std::move(step);
}

}  // namespace tarnel::wire
