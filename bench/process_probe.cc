#include "bench/process_probe.h"

#include <fstream>
#include <string>

namespace tarnel::bench {
namespace {

// The number after `name` in a file of lines "Name:   123 kB"; 0 without one.
int64_t numberIn(const std::string& path, const std::string& name) {
  std::ifstream file(path);
  std::string line;
  while (std::getline(file, line)) {
    if (line.starts_with(name)) return std::stoll(line.substr(name.size()));
  }
  return 0;
}

}  // namespace

std::optional<ProcessProbe> ProcessProbe::of(pid_t pid) {
  clockid_t clock{};
  if (clock_getcpuclockid(pid, &clock) != 0) return std::nullopt;
  return ProcessProbe(pid, clock);
}

double ProcessProbe::cpuSeconds() const {
  timespec time{};
  clock_gettime(clock_, &time);
  return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

ProcessMemory ProcessProbe::memory() const {
  const std::string folder = "/proc/" + std::to_string(pid_);
  const std::string rollup = folder + "/smaps_rollup";
  return {.resident = numberIn(folder + "/status", "VmRSS:"),
          .own = numberIn(rollup, "Private_Clean:") + numberIn(rollup, "Private_Dirty:"),
          .threads = numberIn(folder + "/status", "Threads:")};
}

}  // namespace tarnel::bench
