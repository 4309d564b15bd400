#pragma once

#include <cstddef>
#include <string_view>

// Text as RFC 3629 writes it. Threads: any.

namespace tarnel {

// True when the bytes are well-formed: the shortest form, no surrogates, nothing beyond U+10FFFF.
bool isValidUtf8(std::string_view text) noexcept;

// Bytes of the well-formed character at the front, 1 to 4; 0 when there is none.
size_t utf8CharacterLength(std::string_view text) noexcept;

// The longest beginning of at most that many bytes that does not cut through a character. Bytes that are no
// UTF-8 are kept as they are.
std::string_view wholeCharacters(std::string_view text, size_t maxBytes) noexcept;

}  // namespace tarnel
