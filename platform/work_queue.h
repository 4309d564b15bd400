#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>

#include "base/one_shot.h"

namespace tarnel {

using Task = OneShot<void()>;

// Something that keeps happening on a work queue: the ticks of a timer, or a descriptor with something to
// read. Letting go of a source cancels it.
class EventSource {
 public:
  EventSource() = default;
  EventSource(const EventSource&) = delete;
  EventSource& operator=(const EventSource&) = delete;
  virtual ~EventSource() = default;

  // From now on `eventHandler` runs on the queue at every event. Both handlers, and whatever they captured,
  // are held until the source is cancelled: they may keep the source's own owner alive. Call it once.
  virtual void start(std::function<void()> eventHandler, Task cancelHandler) = 0;
  // No event is handled after this when it is called on the queue; from another thread one more may be.
  // cancelHandler then runs on the queue, once, also when this was called by the event handler. Does nothing
  // a second time. Threads: any.
  virtual void cancel() = 0;
};

// Runs tasks one after the other, in the order in which they were handed over. Tasks must not block: other
// queues may wait for them.
//
// Threads: any, for all operations; handlers and tasks run on a thread of the platform's.
class WorkQueue {
 public:
  WorkQueue() = default;
  WorkQueue(const WorkQueue&) = delete;
  WorkQueue& operator=(const WorkQueue&) = delete;
  virtual ~WorkQueue() = default;

  // Runs the task as soon as those before it are done.
  virtual void async(Task task) = 0;
  // Runs the task once, that much later (at least 0).
  virtual void after(std::chrono::nanoseconds delay, Task task) = 0;

  // A timer that ticks one period after its start, then every period (more than 0). Ticks may come late by up
  // to `leeway`, but no more than half a period, so that the ticks of several timers can share one wake-up;
  // those that were missed altogether are one tick. Null when none can be had.
  virtual std::unique_ptr<EventSource> makeTimer(std::chrono::nanoseconds period,
                                                 std::chrono::nanoseconds leeway) = 0;
  // An event whenever the descriptor has something to read, again and again until it is read. The descriptor
  // must stay open until the cancel handler runs. Null when it cannot be waited for.
  virtual std::unique_ptr<EventSource> makeReadSource(int descriptor) = 0;
};

// Where queues come from. What comes from here must be gone before this is. Threads: any.
class WorkQueues {
 public:
  WorkQueues() = default;
  WorkQueues(const WorkQueues&) = delete;
  WorkQueues& operator=(const WorkQueues&) = delete;
  virtual ~WorkQueues() = default;

  // The label names the queue in the log. Null when none can be had (logged).
  virtual std::shared_ptr<WorkQueue> makeQueue(std::string label) = 0;
};

}  // namespace tarnel
