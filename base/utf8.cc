#include "base/utf8.h"

#include <algorithm>
#include <cstdint>
#include <cstring>

namespace tarnel {

namespace {

constexpr size_t kLongestCharacter = 4;

bool isContinuation(char c) noexcept {
  return (static_cast<uint8_t>(c) & 0xC0U) == 0x80U;
}

}  // namespace

bool isValidUtf8(std::string_view text) noexcept {
  const auto byteAt = [&text](size_t i) { return static_cast<uint8_t>(text[i]); };
  for (size_t i = 0; i < text.size();) {
    // Nearly all text is ASCII: eight bytes at a time.
    if (uint64_t eight = 0; text.size() - i >= sizeof eight) {
      std::memcpy(&eight, text.data() + i, sizeof eight);
      if ((eight & 0x8080808080808080U) == 0) {
        i += sizeof eight;
        continue;
      }
    }
    const uint8_t lead = byteAt(i);
    if (lead < 0x80) {
      ++i;
      continue;
    }
    const size_t length = lead >= 0xF0 ? 4 : lead >= 0xE0 ? 3 : 2;
    if (lead < 0xC2 || lead > 0xF4 || text.size() - i < length) return false;
    const uint8_t second = byteAt(i + 1);
    const uint8_t low = lead == 0xE0 ? 0xA0 : lead == 0xF0 ? 0x90 : 0x80;
    const uint8_t high = lead == 0xED ? 0x9F : lead == 0xF4 ? 0x8F : 0xBF;
    if (second < low || second > high) return false;
    for (size_t k = 2; k < length; ++k) {
      if ((byteAt(i + k) & 0xC0U) != 0x80) return false;
    }
    i += length;
  }
  return true;
}

size_t utf8CharacterLength(std::string_view text) noexcept {
  for (size_t length = 1; length <= kLongestCharacter && length <= text.size(); ++length) {
    if (isValidUtf8(text.substr(0, length))) return length;
  }
  return 0;
}

std::string_view wholeCharacters(std::string_view text, size_t maxBytes) noexcept {
  if (text.size() <= maxBytes) return text;
  // A character reaches over at most three bytes more; a longer run of continuations is none and is cut
  // anywhere.
  size_t end = maxBytes;
  const size_t least = maxBytes - std::min(maxBytes, kLongestCharacter - 1);
  while (end > least && isContinuation(text[end])) --end;
  return text.substr(0, end);
}

}  // namespace tarnel
