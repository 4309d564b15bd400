#pragma once

#include <cstdint>
#include <string>
#include <string_view>

// D-Bus messages out of their parts, right in their lengths and padding, whatever their bodies hold.

namespace tarnel::fuzz {

struct DbusFrame {
  uint8_t type = 1;  // 1 call, 2 return, 3 error, 4 signal
  uint8_t flags = 0;
  uint32_t serial = 1;
  uint32_t replySerial = 0;  // 0: none
  std::string_view path;
  std::string_view interface;
  std::string_view member;
  std::string_view errorName;
  std::string_view signature;
  uint32_t descriptors = 0;
  std::string_view body;
};

std::string bytesOf(const DbusFrame& frame);

// Messages of each type in what a peer wrote after its part of the authentication, which stands before; ends
// at anything that is none.
struct DbusCounts {
  size_t calls = 0;
  size_t returns = 0;
  size_t errors = 0;
};
DbusCounts countMessages(std::string_view written);

}  // namespace tarnel::fuzz
