#pragma once

#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

// Text ignoring case, for the whole system. Every letter becomes the small letter of its capital, by the
// tables of the C library, one character to one: so "σ" and the final "ς" agree, "s" and the long "ſ", "k" and
// the Kelvin sign. The user's locale plays no part. A letter and its folded form may differ in length.
//
// Where the system has no locale "C.UTF-8", and in text that is not UTF-8, only the letters of ASCII are
// folded.
//
// Names that a standard confines to ASCII, such as those of HTTP headers, are not compared by this.
//
// Threads: all functions may be called from any thread.

namespace tarnel {

std::string foldCase(std::string_view text);

// Whether the text folds to `folded`, which is a text that foldCase returned.
bool equalsFolded(std::string_view folded, std::string_view text);

// False where the C library's tables are not to be had.
bool foldsBeyondAscii() noexcept;

// Such a text keeps its length when it is folded.
inline bool isAscii(std::string_view text) noexcept {
  constexpr uint64_t kHighBits = 0x8080808080808080U;
  uint64_t bits = 0;
  for (; text.size() >= sizeof bits; text.remove_prefix(sizeof bits)) {
    std::memcpy(&bits, text.data(), sizeof bits);
    if ((bits & kHighBits) != 0) return false;
  }
  for (const char c : text) {
    if (static_cast<unsigned char>(c) >= 0x80) return false;
  }
  return true;
}

}  // namespace tarnel
