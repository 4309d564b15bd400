#pragma once

#include <cstddef>
#include <memory>
#include <mutex>
#include <string>

#include "base/log.h"
#include "platform/work_queue.h"

namespace tarnel {

// Queues that share one thread, which starts with the first queue (in the daemon: after confinement) and ends
// with this object. One thread makes every queue serial; a queue of its own thread each would cost a session
// a stack and a switch for what is a few system calls.
//
// A task that throws is logged with its queue's label, and the thread goes on.
class AsioWorkQueues final : public WorkQueues {
 public:
  explicit AsioWorkQueues(Log& log);  // the log must outlive this object
  ~AsioWorkQueues() override;

  std::shared_ptr<WorkQueue> makeQueue(std::string label) override;

  // Sources that were started and whose cancel handler has not yet run to its end. Threads: any.
  size_t sourcesUnderWay() const;

  struct Executor;

 private:
  Log& log_;
  mutable std::mutex mutex_;
  std::unique_ptr<Executor> executor_;  // under the mutex; there once the thread runs
};

}  // namespace tarnel
