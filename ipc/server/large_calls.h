#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <mutex>
#include <optional>
#include <utility>

namespace tarnel {

// Large messages of one user's clients that are at work at the same time. What is decoded may take ten times
// the bytes of its message and more, so many clients with large ones would make us hold that for each. Those
// beyond the bound wait with their message as it came, behind calls of the same user and nobody else's, in
// the order in which they came, for a limited time.
//
// Threads: any.
class LargeCalls {
 public:
  using SteadyTime = std::chrono::steady_clock::time_point;
  enum class Kind {
    prompt,  // runs the session's and the adaptors' code, and waits for nobody outside
    upload,  // may wait for a server until it has answered
  };
  // What it needs of the process; tests put their own.
  struct Heap {
    // Gives what the C library keeps of freed memory back to the system. Stops every thread that allocates.
    std::function<void()> trim = trimHeap;
    // Told, on any thread, that trimOwed() has something to do.
    std::function<void()> owed = [] {};
    std::function<SteadyTime()> now = [] { return std::chrono::steady_clock::now(); };
  };
  static void trimHeap();
  static constexpr std::chrono::seconds kTrimEvery{10};

  // bytesAtWork: of each user and kind. A message that is alone may always work.
  explicit LargeCalls(size_t bytesAtWork) : LargeCalls(bytesAtWork, Heap()) {}
  LargeCalls(size_t bytesAtWork, Heap heap) : bytesAtWork_(bytesAtWork), heap_(std::move(heap)) {}

  // Room for one message, given back when destroyed.
  class Place {
   public:
    using Key = std::pair<uint32_t, Kind>;
    Place(LargeCalls& calls, Key key, size_t bytes) noexcept : calls_(&calls), key_(key), bytes_(bytes) {}
    Place(Place&& other) noexcept
        : calls_(std::exchange(other.calls_, nullptr)), key_(other.key_), bytes_(other.bytes_) {}
    Place& operator=(Place&&) = delete;
    ~Place() {
      if (calls_ != nullptr) calls_->leave(key_, bytes_);
    }

   private:
    LargeCalls* calls_;
    Key key_;
    size_t bytes_;
  };
  // Waits at most `limit` for room. Nothing when there was none, or after stop().
  std::optional<Place> enter(uint32_t uid, Kind kind, size_t bytes, std::chrono::milliseconds limit);

  // Trims the heap if that is owed: what was decoded is kept by the C library, for every thread anew. Not
  // while any call is at work, nor more often than every kTrimEvery; a thread that waits for nobody's message
  // does it. Returns after what time to call again, nothing when owed() will tell.
  std::optional<std::chrono::milliseconds> trimOwed();

  // Nobody waits any more, and nobody enters.
  void stop();
  bool stopped() const;
  // How many stand in line, for tests.
  size_t waiting(uint32_t uid, Kind kind) const;

 private:
  struct Waiting {
    explicit Waiting(size_t size) : bytes(size) {}
    const size_t bytes;
    bool entered = false;
    std::condition_variable changed;
  };
  struct Line {
    size_t atWork = 0;
    std::list<Waiting*> waiting;  // the first to come is the first to go
  };

  bool fits(const Line& line, size_t bytes) const;
  void admitWaiting(Line& line);
  void removeIfUnused(Place::Key key);
  bool isTrimOwed() const;
  void leave(Place::Key key, size_t bytes);

  const size_t bytesAtWork_;
  const Heap heap_;
  mutable std::mutex mutex_;
  // All below guarded by mutex_.
  std::map<Place::Key, Line> lines_;
  size_t leftSinceTrim_ = 0;
  std::optional<SteadyTime> lastTrim_;
  bool stopped_ = false;
};

}  // namespace tarnel
