#include "ipc/dbus/descriptor_passing.h"

#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <bit>
#include <cstdint>
#include <cstring>

#include "ipc/protocol/wire.h"

namespace tarnel {
namespace {

constexpr size_t kFixedHeader = 16;
constexpr char kUnixFds = 9;  // field of the header

uint32_t numberAt(std::string_view message, size_t offset) {
  uint32_t number = 0;
  std::memcpy(&number, message.data() + offset, sizeof(number));
  const bool isNative = (message.front() == 'l') == (std::endian::native == std::endian::little);
  return isNative ? number : __builtin_bswap32(number);
}

constexpr size_t aligned(size_t offset, size_t alignment) {
  return (offset + alignment - 1) / alignment * alignment;
}

// Past the value of a header field, whose types are few; 0 when it is another or does not fit.
size_t endOfValue(std::string_view header, char type, size_t at) {
  if (type == 'g') return at < header.size() ? at + 1 + static_cast<uint8_t>(header[at]) + 1 : 0;
  if (type != 's' && type != 'o' && type != 'u') return 0;
  at = aligned(at, 4);
  if (at + 4 > header.size()) return 0;
  return type == 'u' ? at + 4 : at + 4 + numberAt(header, at) + 1;
}

// Where the header says how many descriptors belong to the message; 0 when it does not, nothing when it
// cannot be understood.
std::optional<size_t> findAnnouncement(std::string_view message) {
  const auto header = message.substr(0, kFixedHeader + numberAt(message, 12));
  size_t at = kFixedHeader;
  while (at < header.size()) {
    // A field: its code, the signature of its value (here always one type), the value.
    at = aligned(at, 8);
    if (at + 4 > header.size() || header[at + 1] != 1 || header[at + 3] != 0) return std::nullopt;
    const char code = header[at];
    const char type = header[at + 2];
    const size_t end = endOfValue(header, type, at + 4);
    if (end == 0 || end > header.size()) return std::nullopt;
    if (code == kUnixFds) {
      if (type != 'u') return std::nullopt;
      return end - 4;
    }
    at = end;
  }
  return 0;
}

}  // namespace

ssize_t receiveWithDescriptors(int socket, char* room, size_t size, std::vector<UniqueFd>& into) {
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int) * wire::kMaxDescriptors)> control{};
  iovec bytes{room, size};
  msghdr message{};
  message.msg_iov = &bytes;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  const auto got = recvmsg(socket, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  if (got < 0) return got;
  for (auto* header = CMSG_FIRSTHDR(&message); header != nullptr; header = CMSG_NXTHDR(&message, header)) {
    if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS) continue;
    const size_t count = (header->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (size_t i = 0; i < count; ++i) {
      int descriptor = -1;
      std::memcpy(&descriptor, CMSG_DATA(header) + i * sizeof(int), sizeof(int));
      into.emplace_back(descriptor);
    }
  }
  return got;
}

size_t headerSize(std::string_view message) {
  return kFixedHeader + aligned(size_t{numberAt(message, 12)}, 8);
}

std::optional<unsigned> announcedDescriptors(std::string_view message) {
  const auto at = findAnnouncement(message);
  if (!at) return std::nullopt;
  return *at == 0 ? 0 : numberAt(message, *at);
}

void announceNoDescriptors(std::span<char> message) {
  const auto at = findAnnouncement({message.data(), message.size()});
  if (at && *at != 0) std::fill_n(message.begin() + static_cast<std::ptrdiff_t>(*at), 4, '\0');
}

void LastNumber::begin(char byteOrder) noexcept {
  byteOrder_ = byteOrder;
  bytes_ = {};
}

void LastNumber::add(std::string_view piece) noexcept {
  piece = piece.substr(piece.size() - std::min(piece.size(), bytes_.size()));
  std::shift_left(bytes_.begin(), bytes_.end(), static_cast<std::ptrdiff_t>(piece.size()));
  std::copy(piece.begin(), piece.end(), bytes_.end() - static_cast<std::ptrdiff_t>(piece.size()));
}

uint32_t LastNumber::value() const noexcept {
  const std::array<char, 5> message{byteOrder_, bytes_[0], bytes_[1], bytes_[2], bytes_[3]};
  return numberAt({message.data(), message.size()}, 1);
}

}  // namespace tarnel
