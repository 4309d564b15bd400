#include "ipc/dbus/input_framer.h"

#include <algorithm>
#include <bit>
#include <cstring>

namespace tarnel {
namespace {

constexpr size_t kFixedHeader = 16;
constexpr std::string_view kLastLine = "BEGIN\r\n";
// Of the authentication, all lines together; what is customary has less than 100.
constexpr size_t kMaxAuthentication = 4096;

uint32_t numberAt(std::string_view header, size_t offset, bool isLittleEndian) {
  uint32_t number = 0;
  std::memcpy(&number, header.data() + offset, sizeof(number));
  const bool isNative = isLittleEndian == (std::endian::native == std::endian::little);
  return isNative ? number : __builtin_bswap32(number);
}

}  // namespace

std::optional<size_t> InputFramer::admit(std::string_view bytes) {
  size_t admitted = 0;
  if (authenticating_) {
    const auto lines = admitAuthentication(bytes);
    if (!lines) return std::nullopt;
    admitted = *lines;
  }
  while (!authenticating_ && admitted < bytes.size()) {
    if (restOfMessage_ == 0) {
      const auto size = sizeOfNext(bytes.substr(admitted));
      if (!size) return std::nullopt;
      if (*size == 0) break;
      restOfMessage_ = *size;
    }
    const size_t step = std::min(restOfMessage_, bytes.size() - admitted);
    admitted += step;
    restOfMessage_ -= step;
    if (restOfMessage_ == 0) ++completed_;
  }
  return admitted;
}

// The authentication ends with a line that is BEGIN. What a line is must be the same here as for the library,
// or the client would choose what each of us takes for a message: it ends with both of "\r\n", and before the
// first one there is a NUL.
std::optional<size_t> InputFramer::admitAuthentication(std::string_view bytes) {
  for (size_t i = 0; i < bytes.size(); ++i) {
    if (authenticationBytes_++ == kMaxAuthentication) {
      refusal_ = "its authentication takes more than " + std::to_string(kMaxAuthentication) + " bytes";
      return std::nullopt;
    }
    if (authenticationBytes_ == 1) continue;
    line_ += bytes[i];
    if (!line_.ends_with("\r\n")) continue;
    if (line_ == kLastLine) {
      authenticating_ = false;
      line_ = std::string();
      return i + 1;
    }
    line_.clear();
  }
  return bytes.size();
}

std::optional<size_t> InputFramer::sizeOfNext(std::string_view header) {
  if (header.size() < kFixedHeader) return 0;
  const char order = header.front();
  if (order != 'l' && order != 'B') {
    refusal_ = "it broke the protocol: no message begins with this byte";
    return std::nullopt;
  }
  const uint64_t body = numberAt(header, 4, order == 'l');
  const uint64_t fields = numberAt(header, 12, order == 'l');
  const uint64_t size = kFixedHeader + (fields + 7) / 8 * 8 + body;
  if (size > maxMessageBytes_) {
    refusal_ = "a message of " + std::to_string(size) + " bytes exceeds the limit of " +
               std::to_string(maxMessageBytes_) + " bytes";
    return std::nullopt;
  }
  return size;
}

}  // namespace tarnel
