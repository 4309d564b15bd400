#pragma once

#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

// Text ignoring case, and text in small letters, for the whole system: by the tables of the C library, one
// character to one. The user's locale plays no part. A letter and what becomes of it may differ in length.
//
// Where the system has no locale "C.UTF-8", and in text that is not UTF-8, only the letters of ASCII are
// changed.
//
// Names that a standard confines to ASCII, such as those of HTTP headers, are not compared by this.
//
// Threads: all functions may be called from any thread.

namespace tarnel {

namespace detail {
template <class Word>
Word wordAt(const char* bytes) noexcept {
  Word word;
  std::memcpy(&word, bytes, sizeof word);
  return word;
}
}  // namespace detail

// For comparing. Every letter becomes the small letter of its capital: so "σ" and the final "ς" agree, "s"
// and the long "ſ", "k" and the Kelvin sign, and "i" with or without its dot.
std::string foldCase(std::string_view text);

// Every capital becomes its small letter; what is a small letter already stays as it is, so "ς" and "σ"
// remain two.
std::string lowerCase(std::string_view text);

// Whether the text folds to `folded`, which is a text that foldCase returned.
bool equalsFolded(std::string_view folded, std::string_view text);

// False where the C library's tables are not to be had.
bool foldsBeyondAscii() noexcept;

// Such a text keeps its length when it is folded. Asked for every field of every event: words of eight bytes,
// the last of which overlaps the one before; short texts likewise by words of four.
inline bool isAscii(std::string_view text) noexcept {
  constexpr uint64_t kHighBits = 0x8080808080808080U;
  const char* const bytes = text.data();
  const size_t size = text.size();
  uint64_t all = 0;
  if (size >= 8) {
    for (size_t i = 0; i + 8 < size; i += 8) all |= detail::wordAt<uint64_t>(bytes + i);
    all |= detail::wordAt<uint64_t>(bytes + size - 8);
  } else if (size >= 4) {
    all = detail::wordAt<uint32_t>(bytes) | detail::wordAt<uint32_t>(bytes + size - 4);
  } else {
    for (const char c : text) all |= static_cast<unsigned char>(c);
  }
  return (all & kHighBits) == 0;
}

}  // namespace tarnel
