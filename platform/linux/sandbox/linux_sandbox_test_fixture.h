#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <string>

#include "base/file_access.h"
#include "platform/linux/sandbox/linux_sandbox.h"
#include "testing/linux_test_support.h"

namespace tarnel {

inline constexpr char kName[] = "com.orvane.tarneld";

// An instance in a folder of its own, with the shipped profile.
class LinuxSandboxTest : public testing::Test {
 protected:
  LinuxSandboxTest() {
    for (const char* name : {"run", "state", "logs", "etc", "etc/sandbox.d", "bundle", "outside"}) {
      folder_.makeDirectory(name);
    }
    folder_.write("outside/file", "secret");
    folder_.write("bundle/version", "8.2\n");
    const auto shipped = readFile(TARNEL_SHIPPED_PROFILE);
    if (shipped) shipped_ = shipped->text;
    writeProfile(shipped_);
  }

  std::string path(const std::string& name) const { return folder_.path(name); }
  std::string profilePath() const { return path("etc/sandbox.d/com.orvane.tarneld.profile"); }
  void writeProfile(const std::string& text) {
    folder_.write("etc/sandbox.d/com.orvane.tarneld.profile", text);
  }

  LinuxSandbox sandbox() const {
    return LinuxSandbox(path("etc"), {{"RUNTIME", path("run")},
                                      {"STATE", path("state")},
                                      {"LOGS", path("logs")},
                                      {"CONFIGURATION", path("etc")},
                                      {"MESSAGE_LOGS", path("logs/messages")},
                                      {"BUNDLE", path("bundle")},
                                      {"BUNDLE_ROOT", path("root")}});
  }

  // What entering says, in a process of its own.
  std::string enterInChild(const std::string& name = kName) const {
    return runInChild([this, &name] { return sandbox().enter(name).value_or("confined"); });
  }
  // What the action says after the process was confined.
  std::string confined(const std::function<std::string()>& action) const {
    return runInChild([this, &action] {
      preloadLazyFacilities();
      if (auto failure = sandbox().enter(kName)) return "not confined: " + *failure;
      return action();
    });
  }

  TemporaryFolder folder_;
  std::string shipped_;
};

}  // namespace tarnel
