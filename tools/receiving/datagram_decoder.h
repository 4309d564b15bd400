#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "tools/receiving/event_check.h"

// Dashboard datagrams, read as docs/dashboard-datagrams.md describes them. Threads: any.

namespace tarnel::lab {

inline constexpr size_t kDatagramHeaderBytes = 64;
inline constexpr size_t kMaxDatagramBytes = kDatagramHeaderBytes + 1023;

struct DashboardDatagram {
  unsigned int reportVersion = 0;  // major version of the report format
  unsigned int clientType = 0;
  double time = 0;  // seconds since 1970, in steps of 4 ms
  uint32_t sessionID = 0;
  uint16_t clientVersion = 0;
  uint16_t method = 0;
  uint16_t status = 0;
  std::string device;
  uint16_t event = 0;
  bool isReliable = false;  // is to be acknowledged
  bool isServerFromStorebag = false;
  std::string text;  // as it came
  // Keys and values, the latter as they were before they were escaped. When the text was cut, so may be the
  // last value, and a key without a value may stand in it.
  std::vector<std::pair<std::string, std::string>> entries;
};

// Nothing, with the reason among the problems, when the bytes are no datagram of this format. Problems with
// a datagram that could be read are told, too.
std::optional<DashboardDatagram> readDatagram(std::span<const uint8_t> bytes, Problems& problems);

// What a server sends back: the datagram's first 62 bytes, of which the last two, the event number, count.
// Too short to be taken for a datagram itself, so that two servers never acknowledge each other. The
// datagram has a whole header.
std::vector<uint8_t> acknowledgementOf(std::span<const uint8_t> datagram);

}  // namespace tarnel::lab
