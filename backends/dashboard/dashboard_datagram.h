#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "base/types.h"
#include "base/value.h"

// What goes over the wire to a dashboard server; docs/dashboard-datagrams.md describes it for servers.
//
// Threads: all functions may be called from any thread.

namespace tarnel {

inline constexpr size_t kDashboardHeaderSize = 64;
inline constexpr size_t kDashboardTextArea = 1024;  // one byte of it stays free
inline constexpr size_t kDashboardMaxText = kDashboardTextArea - 1;

using DashboardBuffer = std::array<uint8_t, kDashboardHeaderSize + kDashboardTextArea>;

struct DashboardHeader {
  uint8_t selfVersionMajor = 0;
  int32_t compType = 0;
  TimeValue timestamp;
  uint32_t sessionID = 0;
  uint16_t clientVersion = 0;
  Method method{};
  RespCode respCode{};
  std::string_view udid;  // its first 40 bytes; a shorter one is followed by zero bytes
  EventID eventID{};
  bool isReliable = false;
  bool isServerFromProfile = false;
};

// Writes header and text into the buffer and returns the length of the datagram.
size_t writeDashboardDatagram(const DashboardHeader& header, const std::string& text,
                              DashboardBuffer& buffer);

// " key=value" for each entry, those with the shortest values first (in the payload's order where they are
// equally long), cut to kDashboardMaxText bytes, but never inside a character. Where it is cut it ends.
std::string dashboardText(const Dictionary& payload);

// descriptionForObject:
// Text as it is, numbers in decimal, "null" for anything else.
std::string descriptionForObject(const Value& object);

// sanitize:
// Without line ends; backslashes and equal signs escaped with a backslash; "empty" when nothing is left.
std::string sanitize(std::string_view text);

// writeLocalLog:
// The datagram as one line, each value read back from its header.
std::string writeLocalLog(std::span<const uint8_t> datagram);

// The event number that a datagram from the server acknowledges; nothing when it is too short to name one.
std::optional<EventID> acknowledgedEvent(std::span<const uint8_t> datagram);

}  // namespace tarnel
