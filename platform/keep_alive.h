#pragma once

namespace tarnel {

// The process transaction: while one is open, or other work is under way, the process does not end itself.
// Threads: any.
class KeepAlive {
 public:
  KeepAlive() = default;
  KeepAlive(const KeepAlive&) = delete;
  KeepAlive& operator=(const KeepAlive&) = delete;
  virtual ~KeepAlive() = default;

  virtual void beginTransaction() = 0;
  virtual void endTransaction() = 0;
};

}  // namespace tarnel
