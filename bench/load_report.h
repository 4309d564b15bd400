#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <vector>

#include "bench/load_options.h"
#include "bench/process_probe.h"

namespace tarnel::bench {

struct LoadReport {
  ProcessMemory start;
  // With `idle` sessions, connected and then configured.
  std::optional<ProcessMemory> connected;
  std::optional<ProcessMemory> configured;
  // While messages were sent: at the beginning, after each tenth of them, at the end.
  std::vector<ProcessMemory> course;
  size_t messages = 0;
  double seconds = 0;
  double cpuSeconds = 0;  // of the daemon
};

// For people, or one JSON object.
std::string describe(const LoadReport& report, const LoadOptions& options);

}  // namespace tarnel::bench
