#pragma once

#include <memory>
#include <optional>
#include <string>

#include "base/log.h"
#include "ipc/ipc.h"
#include "util/dependencies.h"

namespace tarnel {

// What the start-up does to the process and takes from it, in the order of use. main has the real one.
// Threads: everything runs on the main thread, which is the only one until the sandbox is entered.
class ServiceHost {
 public:
  ServiceHost() = default;
  ServiceHost(const ServiceHost&) = delete;
  ServiceHost& operator=(const ServiceHost&) = delete;
  virtual ~ServiceHost() = default;

  // Puts the calling thread, and so those that it starts, into the utility class: what nobody waits for.
  virtual void setUtilityQualityOfService() = 0;
  // The log must last until stopLogging().
  virtual Log& startLogging(const char* processName, const char* facility) = 0;
  // Reads and loads what will be out of reach afterwards. Starts no thread and opens no service.
  virtual void prepareForConfinement() = 0;
  // The text says why the process is not confined, and the remedy; nothing means: confined.
  virtual std::optional<std::string> enterSandbox(const char* profileName) = 0;
  virtual const Dependencies& dependencies() = 0;
  virtual std::unique_ptr<IpcListener> createListener(const char* serviceName) = 0;
  // Tells the service manager that clients are served.
  virtual void notifyReady() = 0;
  // Runs until the process is told to end. Returns the status to exit with: 0 unless the loop failed.
  virtual int runEventLoop() = 0;
  // Waits, for a bounded time, for the posts that the sessions started when they ended.
  virtual void finishPosts() = 0;
  virtual void stopLogging() = 0;
};

// The daemon from start to end. Returns the process's exit status: 0 when the loop was told to end, -1 (255
// as the parent sees it) when the process cannot be confined, 1 when the service cannot be opened or the loop
// fails; each failure has been logged.
int runService(ServiceHost& host);

}  // namespace tarnel
