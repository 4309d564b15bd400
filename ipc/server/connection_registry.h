#pragma once

#include <pthread.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <unordered_map>
#include <variant>
#include <vector>

#include "base/unique_fd.h"
#include "ipc/server/connection_link.h"
#include "ipc/server/ipc_limits.h"
#include "ipc/server/large_calls.h"

namespace tarnel {

// Stack of a connection's thread. Only what is touched becomes resident; the sanitizers' frames are larger.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
inline constexpr size_t kConnectionStackBytes = size_t{4} << 20U;
#else
inline constexpr size_t kConnectionStackBytes = size_t{256} << 10U;
#endif

// The connections of a listener: how many there are, and their threads. Threads: any, unless noted.
class ConnectionRegistry : public std::enable_shared_from_this<ConnectionRegistry> {
 public:
  // A connection that counts; gives its place back when destroyed.
  class Place {
   public:
    Place(std::shared_ptr<ConnectionRegistry> registry, uint32_t uid) noexcept
        : registry_(std::move(registry)), uid_(uid) {}
    Place(Place&&) noexcept = default;
    Place& operator=(Place&&) = delete;
    ~Place() {
      if (registry_ != nullptr) registry_->leave(uid_);
    }

   private:
    std::shared_ptr<ConnectionRegistry> registry_;
    uint32_t uid_;
  };
  enum class Full { perUser, total };
  using CreateThread = std::function<int(pthread_t* thread, const pthread_attr_t* attributes,
                                         void* (*run)(void*), void* argument)>;

  // trimHeap: what LargeCalls is to trim memory with. createThread: pthread_create but for tests.
  ConnectionRegistry(const IpcLimits& limits, std::function<void()> trimHeap,
                     CreateThread createThread = pthread_create);

  // Of all connections. Lives as long as this.
  LargeCalls& largeCalls() noexcept { return largeCalls_; }

  // A place, or the limit that stands against it.
  std::variant<Place, Full> enter(uint32_t uid);
  size_t connections() const;

  // Runs body on a new thread; link is how stopAll() reaches it. Returns 0, or the number of the error when
  // the system gives no thread; ECANCELED when the registry is being stopped.
  [[nodiscard]] int start(std::shared_ptr<ConnectionLink> link, std::function<void()> body);
  size_t threads() const;

  // Readable when a thread is over and waits for reap(), or largeCalls().trimOwed() has something to do; for
  // the main loop.
  int finishedDescriptor() const noexcept { return finishedEvent_.get(); }
  // Joins what is over; never waits for a thread that still runs.
  void reap();
  // Stops all connections and joins their threads; waits at most limits.ending for calls that are being run.
  // Returns how many threads still run then: in a system call that does not return. Whatever they use must
  // outlive them.
  size_t stopAll();

 private:
  struct Thread {
    std::shared_ptr<ConnectionLink> link;
    pthread_t handle{};
  };
  struct Start {
    std::shared_ptr<ConnectionRegistry> registry;
    uint64_t id;
    std::function<void()> body;
  };

  static void* runThread(void* start);
  void leave(uint32_t uid);
  void finished(uint64_t id);

  const IpcLimits limits_;
  const CreateThread createThread_;
  const UniqueFd finishedEvent_;
  LargeCalls largeCalls_;

  mutable std::mutex mutex_;
  // All below guarded by mutex_.
  size_t connections_ = 0;
  std::unordered_map<uint32_t, unsigned> connectionsOfUser_;
  std::map<uint64_t, Thread> running_;
  std::vector<pthread_t> over_;
  uint64_t lastId_ = 0;
  bool stopping_ = false;
  bool leftBehind_ = false;  // nobody joins what still runs
};

}  // namespace tarnel
