#pragma once

#include <memory>
#include <string>

#include "base/error.h"
#include "base/value.h"
#include "platform/clock.h"
#include "tools/lab/console.h"
#include "tools/lab/options.h"

namespace tarnel::lab {

// The whole lab: both servers and what stands behind them. Threads: any.
class Lab {
 public:
  // Listens when it returns. console and clock outlive the lab. The error names the remedy.
  static Result<std::unique_ptr<Lab>> start(const LabOptions& options, Console& console, Clock& clock);

  Lab() = default;
  Lab(const Lab&) = delete;
  Lab& operator=(const Lab&) = delete;
  virtual ~Lab() = default;

  // What the control address tells under /status.
  virtual Dictionary status() const = 0;
  // A descriptor that becomes readable when somebody asked the control address to stop.
  virtual int stopRequestedFd() const = 0;
  // Ends both servers; returns when no request is left. Idempotent.
  virtual void stop() = 0;
};

}  // namespace tarnel::lab
