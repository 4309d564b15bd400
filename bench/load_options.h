#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

namespace tarnel::bench {

enum class Payload { small, call };
// How messages travel: many in one bus call, as the library does by itself, or one call for each.
enum class Calls { many, single };

struct LoadOptions {
  std::string socketPath;  // empty: as any client
  int pid = 0;             // of the daemon
  size_t clients = 1;
  size_t messages = 100'000;  // of all clients together
  bool realtime = false;
  Payload payload = Payload::call;
  Calls calls = Calls::many;
  size_t window = 1024;  // messages of one client that wait for their answer
  size_t idle = 0;
  std::string service = "video-call";
  int32_t clientType = 9;
  bool json = false;
  std::chrono::seconds timeout{120};
};

struct ParsedLoadOptions {
  LoadOptions options;
  std::optional<int> exitCode;  // when there is nothing to run
};

ParsedLoadOptions parseLoadOptions(int argc, const char* const* argv);

}  // namespace tarnel::bench
