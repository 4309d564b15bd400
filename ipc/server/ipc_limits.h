#pragma once

#include <chrono>
#include <cstddef>

namespace tarnel {

// How much the clients of the IPC service may make the daemon hold. What goes beyond is closed, with a log
// line that names the limit.
struct IpcLimits {
  unsigned connectionsPerUser = 64;
  unsigned connections = 1024;
  // Calls and answers that wait for a client to read its socket, bytes (estimated) per connection.
  size_t queuedBytes = size_t{1} << 20U;
  // Calls of one connection that are not answered yet; more are not read until some are.
  size_t unansweredCalls = 1024;
  // Messages of one user's clients that are larger than `largeMessage` and at work at the same time, bytes;
  // others wait for their turn.
  size_t largeMessage = size_t{64} << 10U;
  size_t largeBytesAtWork = size_t{4} << 20U;
  // Of a large message for its turn; and of one that may wait for a server, such as log data, while that does
  // not answer for those which came before. After that it is refused.
  std::chrono::milliseconds waitForMessages{30'000};
  std::chrono::milliseconds waitForUploads{60'000};
  // From accepting to the end of the authentication.
  std::chrono::milliseconds authentication{10'000};
  // From the peer's end of sending to the end of the connection.
  std::chrono::milliseconds interruption{5'000};
  // For the calls under way when the service ends; longer than a storebag's fetch.
  std::chrono::milliseconds ending{20'000};
};

}  // namespace tarnel
