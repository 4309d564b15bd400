#include "client/src/options.h"

#include <sys/un.h>

#include <cstdlib>

namespace tarnel::core {
namespace {

constexpr size_t kMaxPathBytes = sizeof(sockaddr_un::sun_path) - 1;

Outcome checkRange(const char* name, int64_t value, int64_t lowest, int64_t highest) {
  if (value >= lowest && value <= highest) return {};
  return failure(TARNEL_ERROR_INVALID_ARGUMENT,
                 std::string("option ") + name + " is " + std::to_string(value) + "; it must be from " +
                     std::to_string(lowest) + " to " + std::to_string(highest));
}

Outcome checkPath(const std::string& path) {
  if (path.size() > kMaxPathBytes) {
    return failure(TARNEL_ERROR_INVALID_ARGUMENT, "the socket path is " + std::to_string(path.size()) +
                                                      " bytes long; at most " +
                                                      std::to_string(kMaxPathBytes) +
                                                      " are possible: set TARNEL_SOCKET or the option "
                                                      "socket_path to a shorter one");
  }
  if (path.front() != '/') {
    return failure(TARNEL_ERROR_INVALID_ARGUMENT, "the socket path \"" + path +
                                                      "\" is not absolute: set TARNEL_SOCKET or the option "
                                                      "socket_path to one that begins with \"/\"");
  }
  return {};
}

}  // namespace

Outcome check(const Options& options) {
  struct Range {
    const char* name;
    int64_t value;
    int64_t lowest;
    int64_t highest;
  };
  const Range ranges[] = {
      {"max_queued_calls", options.maxQueuedCalls, 1, 1'000'000},
      {"max_queued_bytes", options.maxQueuedBytes, 1024, 256U << 20U},
      {"max_unanswered", options.maxUnanswered, 1, 65'536},
      {"connect_timeout_ms", options.connectTimeout.count(), 1, 600'000},
      {"reply_timeout_ms", options.replyTimeout.count(), 1, 86'400'000},
      {"linger_ms", options.linger.count(), 0, 60'000},
  };
  for (const Range& range : ranges) {
    if (auto outcome = checkRange(range.name, range.value, range.lowest, range.highest); !outcome.ok()) {
      return outcome;
    }
  }
  return checkPath(resolveSocketPath(options.socketPath));
}

std::string resolveSocketPath(const std::string& wanted) {
  if (!wanted.empty()) return wanted;
  // Not of a set-group-id program: whoever starts it must not say where its reports go.
  const char* fromEnvironment = secure_getenv("TARNEL_SOCKET");
  return fromEnvironment != nullptr && *fromEnvironment != '\0' ? fromEnvironment : kDefaultSocketPath;
}

}  // namespace tarnel::core
