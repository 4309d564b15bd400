#pragma once

#include <memory>
#include <string>

#include "daemon/service.h"

namespace tarnel {

// The daemon's host on Linux: the platform's real implementations, wired together. Made in main alone.
class LinuxWorld final : public ServiceHost {
 public:
  LinuxWorld();
  ~LinuxWorld() override;

  void setUtilityQualityOfService() override;
  Log& startLogging(const char* processName, const char* facility) override;
  void prepareForConfinement() override;
  std::optional<std::string> enterSandbox(const char* profileName) override;
  const Dependencies& dependencies() override;
  std::unique_ptr<IpcListener> createListener(const char* serviceName) override;
  void notifyReady() override;
  int runEventLoop() override;
  void finishPosts() override;
  void stopLogging() override;
  // Calls of clients still run and use this: the process must end without destroying it.
  bool hasCallsLeftBehind() const noexcept { return callsLeftBehind_; }

 private:
  struct Prepared;

  std::shared_ptr<class TarnelLogging> log_;
  std::unique_ptr<Prepared> prepared_;
  bool callsLeftBehind_ = false;
};

}  // namespace tarnel
