#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "base/hex.h"

namespace tarnel {

// Text for a place in an address: every byte of which mayStand(char) says false becomes %XX with upper-case
// digits (RFC 3986 section 2.1). Threads: any.
template <class MayStand>
std::string percentEncoded(std::string_view text, MayStand mayStand) {
  std::string out;
  out.reserve(text.size());
  for (const char c : text) {
    if (mayStand(c)) {
      out += c;
    } else {
      out += '%';
      appendHex(out, static_cast<uint8_t>(c), kUpperHexDigits);
    }
  }
  return out;
}

// The text as it may stand in the query of a URL: the characters that RFC 3986 allows there are kept
// (letters, digits and -._~!$&'()*+,;=:@/?). An ampersand or an equals sign is not encoded. Threads: any.
std::string percentEncodedForQuery(std::string_view text);

}  // namespace tarnel
