#include "base/percent_encoding.h"

namespace tarnel {
namespace {

bool isAllowedInQuery(char c) {
  if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9')) return true;
  return std::string_view("-._~!$&'()*+,;=:@/?").find(c) != std::string_view::npos;
}

}  // namespace

std::string percentEncodedForQuery(std::string_view text) {
  constexpr char kDigits[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(text.size());
  for (const char c : text) {
    if (isAllowedInQuery(c)) {
      out += c;
      continue;
    }
    const auto byte = static_cast<unsigned char>(c);
    out += {'%', kDigits[byte >> 4U], kDigits[byte & 0xFU]};
  }
  return out;
}

}  // namespace tarnel
