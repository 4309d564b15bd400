#pragma once

#include <optional>
#include <string>

#include "base/unique_fd.h"
#include "platform/linux/sandbox/sandbox_profile.h"

namespace tarnel {

// File and port rules that the kernel holds a process to (landlock(7)). What an older kernel cannot enforce
// is left out: ports before Linux 6.7, abstract sockets and signals before 6.12.
//
// Threads: restrictSelf() binds the calling thread and those it starts afterwards.
class Landlock {
 public:
  // Paths of the profile that do not exist are left out. The error text names the remedy.
  static Result<Landlock> prepare(const SandboxProfile& profile);

  // For good; no_new_privs must be set.
  std::optional<std::string> restrictSelf() const;

 private:
  explicit Landlock(UniqueFd ruleset) : ruleset_(std::move(ruleset)) {}

  UniqueFd ruleset_;
};

}  // namespace tarnel
