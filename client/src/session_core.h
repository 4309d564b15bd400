#pragma once

#include <atomic>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "client/src/lifetime.h"
#include "client/src/mailbox.h"
#include "client/src/options.h"

namespace tarnel::core {

// A session as the C interface wraps it: its queue, its thread, its end.
//
// Threads: any, unless noted.
class SessionCore : public std::enable_shared_from_this<SessionCore> {
 public:
  // Starts the thread, which begins to connect. The reason when there is no session.
  static Outcome create(const Options& options, Handlers handlers, std::shared_ptr<SessionCore>& session);

  // Only create() can name this.
  class Token {
    friend class SessionCore;
    Token() = default;
  };
  SessionCore(Token, const Options& options, Handlers handlers, UniqueFd wake);
  SessionCore(const SessionCore&) = delete;
  SessionCore& operator=(const SessionCore&) = delete;
  ~SessionCore();

  // Takes the request when it is sound and there is room; else its completion is dropped uncalled.
  Outcome submit(Request request);
  Outcome reconnect();
  State state() const;
  bool isOnOwnThread() const { return std::this_thread::get_id() == ownThread_.load(); }
  bool isAggregator() const { return bool(handlers_.aggregatedMessage); }
  // In a child of the process that made the session nothing else may be asked of it.
  bool isForeign() const noexcept { return generation_ != forkGeneration(); }
  Outcome checkProcess() const;

  // Ends the session and waits for its thread, unless called on it.
  void close();

  // The end of the process: no more callbacks; what waits is sent within the linger time.
  void beginExit();
  void awaitEnd(SteadyTime latest);
  SteadyTime closesBy() const { return closesBy_; }
  // In a forked child, under the registry's lock.
  void closeDescriptorsInChild();

 private:
  void run();
  Outcome startThread();
  void join();

  const Options options_;
  const Handlers handlers_;
  const uint32_t generation_;
  Mailbox mailbox_;
  ForkVisibleDescriptor socket_;
  SteadyTime closesBy_{};  // written and read at exit only
  std::vector<Completion> parked_;

  std::mutex endMutex_;
  std::condition_variable ended_;
  bool hasEnded_ = false;  // guarded by endMutex_
  std::mutex joinMutex_;
  std::thread thread_;                        // joined or detached under joinMutex_
  std::atomic<std::thread::id> ownThread_{};  // outlasts detaching
};

}  // namespace tarnel::core
