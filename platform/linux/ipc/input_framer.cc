#include "platform/linux/ipc/input_framer.h"

#include <algorithm>
#include <bit>
#include <cstring>

namespace tarnel {
namespace {

constexpr size_t kFixedHeader = 16;
constexpr std::string_view kLastLine = "BEGIN\r\n";

uint32_t numberAt(std::string_view header, size_t offset, bool isLittleEndian) {
  uint32_t number = 0;
  std::memcpy(&number, header.data() + offset, sizeof(number));
  const bool isNative = isLittleEndian == (std::endian::native == std::endian::little);
  return isNative ? number : __builtin_bswap32(number);
}

}  // namespace

std::optional<size_t> InputFramer::admit(std::string_view bytes) {
  size_t admitted = authenticating_ ? admitAuthentication(bytes) : 0;
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

// The authentication ends with a line that is BEGIN; its bytes are bounded by the library.
size_t InputFramer::admitAuthentication(std::string_view bytes) {
  for (size_t i = 0; i < bytes.size(); ++i) {
    if (line_.size() <= kLastLine.size()) line_ += bytes[i];
    if (bytes[i] != '\n') continue;
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
