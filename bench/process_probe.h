#pragma once

#include <sys/types.h>
#include <time.h>

#include <cstdint>
#include <optional>

namespace tarnel::bench {

// Memory of another process, kilobytes.
struct ProcessMemory {
  int64_t resident = 0;
  // Its own share: pages that no other process has too.
  int64_t own = 0;
  int64_t threads = 0;
};

// Looks at another process from outside. Threads: any.
class ProcessProbe {
 public:
  // Nothing when there is no such process, or it may not be looked at.
  static std::optional<ProcessProbe> of(pid_t pid);

  // Processor time that all its threads have used so far, the kernel's work for them included.
  double cpuSeconds() const;
  // Zeros once the process is gone.
  ProcessMemory memory() const;

 private:
  ProcessProbe(pid_t pid, clockid_t clock) : pid_(pid), clock_(clock) {}

  pid_t pid_;
  clockid_t clock_;
};

}  // namespace tarnel::bench
