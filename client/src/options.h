#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>

#include "client/src/outcome.h"

namespace tarnel::core {

struct Options {
  std::string socketPath;  // resolved before the session is made
  uint32_t maxQueuedCalls = 4096;
  uint32_t maxQueuedBytes = 8U << 20U;
  uint32_t maxUnanswered = 256;
  std::chrono::milliseconds connectTimeout{10'000};
  std::chrono::milliseconds replyTimeout{120'000};
  std::chrono::milliseconds linger{200};
};

// Run on the session's I/O thread, never after it ended. Empty ones are allowed.
struct Handlers {
  std::function<void(const Outcome& why, uint64_t lostCalls)> interruption;
  std::function<void(const Outcome& why, uint64_t lostCalls)> invalidation;
  std::function<void(const MaybeDictionary& messageInfo, double timestamp, uint16_t category, uint16_t type,
                     const MaybeDictionary& payload)>
      aggregatedMessage;
  std::function<void()> aggregationEnd;
  std::function<void()> released;
};

// Names the first option that is out of its range.
Outcome check(const Options& options);

inline constexpr char kDefaultSocketPath[] = "/run/tarneld/com.orvane.tarneld";

// `wanted` if it is not empty, else the environment variable TARNEL_SOCKET (unless this is a set-user-id
// or set-group-id program), else the installed default.
std::string resolveSocketPath(const std::string& wanted);

}  // namespace tarnel::core
