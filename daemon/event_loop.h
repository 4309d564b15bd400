#pragma once

#include <systemd/sd-event.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>

namespace tarnel {

// The main loop: ends on SIGTERM and SIGINT, and runs one timer that any thread may set.
//
// Threads: made, run and destroyed on one thread; armTimer() may be called from any.
class EventLoop {
 public:
  // Throws std::system_error when the system gives none. Blocks SIGTERM and SIGINT for the calling thread and
  // those that it starts, so that they reach the loop alone.
  EventLoop();
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;
  ~EventLoop();

  sd_event* handle() const noexcept { return event_.get(); }

  // Called on the loop's thread with the generation of the timer that elapsed. Set before run().
  void setTimerHandler(std::function<void(uint64_t generation)> handler) { elapsed_ = std::move(handler); }
  // Runs the timer handler after the delay; a timer that was set before is void.
  void armTimer(std::chrono::seconds delay, uint64_t generation);

  // From the loop's thread: run() returns with that status.
  void exit(int status = 0);
  // 0, or a positive status when the loop failed. Once it returned, a second signal ends the process at once.
  int run();

 private:
  struct UnrefEvent {
    void operator()(sd_event* event) const noexcept { sd_event_unref(event); }
  };
  struct UnrefSource {
    void operator()(sd_event_source* source) const noexcept { sd_event_source_disable_unref(source); }
  };
  struct Request {
    uint64_t at = 0;  // microseconds of the monotonic clock
    uint64_t generation = 0;
  };

  void takeRequest();

  std::unique_ptr<sd_event, UnrefEvent> event_;
  int wake_ = -1;
  std::unique_ptr<sd_event_source, UnrefSource> woken_;
  std::unique_ptr<sd_event_source, UnrefSource> timer_;
  std::function<void(uint64_t)> elapsed_;
  uint64_t generation_ = 0;  // of the timer that is set
  std::mutex mutex_;
  std::optional<Request> request_;  // guarded by mutex_
};

}  // namespace tarnel
