#pragma once

#include <memory>
#include <optional>
#include <string>

#include "base/error.h"
#include "platform/linux/sandbox/sandbox_profile.h"

namespace tarnel {

// A filter on system calls (seccomp). What it denies fails with EPERM; socket families that are not allowed
// fail with EAFNOSUPPORT, so that libraries try the next one.
//
// Denied always: starting programs and processes, tracing or reading other processes, mounting and
// namespaces, loading code into the kernel, keys, io_uring, clocks, and taking other processes' descriptors.
// Threads may be started.
class SystemCallFilter {
 public:
  static Result<SystemCallFilter> prepare(const SandboxProfile& profile);

  // Binds the calling thread and those it starts afterwards, for good; no_new_privs must be set.
  std::optional<std::string> load() const;

 private:
  explicit SystemCallFilter(std::shared_ptr<void> context) : context_(std::move(context)) {}

  std::shared_ptr<void> context_;
};

}  // namespace tarnel
