#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

// Bytes as hexadecimal digits (RFC 4648 section 8). Threads: any.

namespace tarnel {

inline constexpr std::string_view kLowerHexDigits = "0123456789abcdef";
inline constexpr std::string_view kUpperHexDigits = "0123456789ABCDEF";

// Appends the byte's two digits. digits: one of the two above.
inline void appendHex(std::string& out, uint8_t byte, std::string_view digits = kLowerHexDigits) {
  out += digits[byte >> 4U];
  out += digits[byte & 15U];
}

// Two digits for each byte, nothing between them.
inline std::string hexText(std::span<const uint8_t> bytes, std::string_view digits = kLowerHexDigits) {
  std::string out;
  out.reserve(bytes.size() * 2);
  for (const uint8_t byte : bytes) appendHex(out, byte, digits);
  return out;
}

}  // namespace tarnel
