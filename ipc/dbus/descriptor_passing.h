#pragma once

#include <sys/types.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

#include "base/unique_fd.h"

// File descriptors that travel beside a connection's bytes. A D-Bus message announces in its header how many
// belong to it, and they come with its first byte.

namespace tarnel {

// recv() without waiting, at most wire::kMaxDescriptors descriptors at once; they are appended to `into`. The
// kernel closes further ones.
ssize_t receiveWithDescriptors(int socket, char* room, size_t size, std::vector<UniqueFd>& into);

// Longest header of a message with descriptors that is looked at, bytes.
inline constexpr size_t kMaxHeaderWithDescriptors = 4096;

// How many descriptors the message announces that begins with these bytes; nothing when its header cannot be
// understood. The bytes must hold the whole header, which headerSize() tells from the first 16.
std::optional<unsigned> announcedDescriptors(std::string_view message);
size_t headerSize(std::string_view message);

// Makes a message that announces descriptors one that announces none.
void announceNoDescriptors(std::span<char> message);

// The last four bytes of a message, which comes in pieces, as the number that they are.
class LastNumber {
 public:
  // Of a message that begins with this byte.
  void begin(char byteOrder) noexcept;
  void add(std::string_view piece) noexcept;
  uint32_t value() const noexcept;

 private:
  char byteOrder_ = 'l';
  std::array<char, 4> bytes_{};
};

}  // namespace tarnel
