#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/linux/configuration/directories.h"
#include "platform/linux/sandbox/sandbox_profile.h"
#include "platform/sandbox.h"

namespace tarnel {

// Confines the process by Landlock, no_new_privs and a system call filter, as
// <configuration>/sandbox.d/<name>.profile says, and then tries what must fail.
//
// Threads: not safe; enter() is for the one thread that the process has.
class LinuxSandbox final : public Sandbox {
 public:
  LinuxSandbox(std::string configurationDirectory, SandboxVariables variables);

  std::optional<std::string> enter(std::string_view profileName) override;

 private:
  std::optional<std::string> probe() const;

  const std::string configurationDirectory_;
  const SandboxVariables variables_;
};

// RUNTIME, STATE, LOGS, CONFIGURATION, MESSAGE_LOGS (the parent of the message log's directory), BUNDLE (the
// client library's) and BUNDLE_ROOT (what stands before the paths of code bundles).
SandboxVariables sandboxVariables(const Directories& directories, const std::string& bundleFolder,
                                  const std::string& bundleRoot);

// Loads what the C library would otherwise load at first use, when files may be out of reach: the name
// service, user data and the time zone. To be called before enter().
void preloadLazyFacilities();

}  // namespace tarnel
