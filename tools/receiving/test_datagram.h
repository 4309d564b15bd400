#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

// Datagrams as docs/dashboard-datagrams.md lays them out, for the tests.

namespace tarnel::lab {

using Bytes = std::vector<uint8_t>;

// Every field has bytes of its own.
inline Bytes sampleDatagram(std::string_view text, bool reliable = true, uint16_t event = 0x0A0B) {
  Bytes bytes = {3,    12,   1,    62,     // version, client type, 1, 62 * 4 ms
                 0x65, 0x53, 0xF1, 0x00,   // 1700000000
                 0xFE, 0xFD, 0xFC, 0xFB,   // session 0x01020304, inverted
                 0xFA, 0xF9,               // client version 0x0506, inverted
                 0,    0,                  // length, below
                 0x07, 0x08, 0x09, 0x0A};  // method, status
  const std::string_view device = "0123456789abcdef0123456789abcdef01234567";
  bytes.insert(bytes.end(), device.begin(), device.end());
  bytes.push_back(static_cast<uint8_t>(event >> 8U));
  bytes.push_back(static_cast<uint8_t>(event));
  bytes.push_back(0);
  bytes.push_back(reliable ? 1 : 0);
  bytes.insert(bytes.end(), text.begin(), text.end());
  const auto length = static_cast<uint16_t>(~bytes.size());
  bytes[14] = static_cast<uint8_t>(length >> 8U);
  bytes[15] = static_cast<uint8_t>(length);
  return bytes;
}

}  // namespace tarnel::lab
