#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "base/one_shot.h"
#include "base/unique_fd.h"

namespace tarnel {

class ConnectionLoop;

// The way to a connection's thread from everywhere else. A bus object belongs to one thread; what others
// want of it is queued here as tasks, never blocking and bounded in bytes.
//
// Threads: any, unless noted. Outlives the connection's thread for as long as somebody holds a reply or a
// proxy; then every call is harmless.
class ConnectionLink {
 public:
  using Task = OneShot<void(ConnectionLoop&)>;
  enum class Posted { queued, closed, full };

  // maxQueuedBytes: bound on the sum of what post() is told.
  explicit ConnectionLink(size_t maxQueuedBytes);

  // Runs the task on the connection's thread when the socket takes data again. `bytes`: about how many the
  // task will send. Full also stops the connection: its client does not read.
  Posted post(size_t bytes, Task task);
  // Asks the thread to drop the connection. The first reason is kept, for the log.
  void stop(std::string reason);
  bool closed() const;

  // Null on every other thread.
  ConnectionLoop* loopOfThisThread() const noexcept;

  // For the connection's thread:
  void bind(ConnectionLoop& loop);
  // Becomes readable when there is something to take.
  int wakeDescriptor() const noexcept { return wake_.get(); }
  void drainWake() const;
  Task takeTask();  // empty when there is none
  std::optional<std::string> stopReason() const;
  // Nothing is taken any more; what waits is dropped.
  void close();

 private:
  void wake() const;

  const size_t maxQueuedBytes_;
  const UniqueFd wake_;
  std::atomic<std::thread::id> owner_{};
  ConnectionLoop* loop_ = nullptr;  // used on the owner's thread only

  mutable std::mutex mutex_;
  // All below guarded by mutex_.
  struct Queued {
    size_t bytes;
    Task task;
  };
  std::unique_ptr<std::deque<Queued>> tasks_;  // null while empty: an idle connection holds no deque
  size_t queuedBytes_ = 0;
  bool closed_ = false;
  std::optional<std::string> stopReason_;
};

// One call of a client that is owed an answer. Destroyed without one, it tells the client that none comes.
// Threads: one at a time.
class CallToken {
 public:
  CallToken(std::shared_ptr<ConnectionLink> link, uint64_t serial) noexcept
      : link_(std::move(link)), serial_(serial) {}
  CallToken(CallToken&&) noexcept = default;
  CallToken& operator=(CallToken&&) = delete;
  ~CallToken();

  // `encode(sd_bus_message*)` appends the answer and returns a MaybeError; it runs on the connection's
  // thread. bytes: about how many it will append.
  template <class Encode>
  void answer(size_t bytes, Encode encode);

 private:
  std::shared_ptr<ConnectionLink> link_;
  uint64_t serial_;
};

}  // namespace tarnel
