#include "base/percent_encoding.h"

namespace tarnel {
namespace {

bool isAllowedInQuery(char c) {
  if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9')) return true;
  return std::string_view("-._~!$&'()*+,;=:@/?").find(c) != std::string_view::npos;
}

}  // namespace

std::string percentEncodedForQuery(std::string_view text) {
  return percentEncoded(text, isAllowedInQuery);
}

}  // namespace tarnel
