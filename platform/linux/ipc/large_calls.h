#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <utility>

namespace tarnel {

// Large messages of one user's clients that are at work at the same time. What is decoded may take ten times
// the bytes of its message and more, so many clients with large ones would make us hold that for each. Those
// beyond the bound wait with their message as it came, behind calls of the same user and nobody else's.
//
// Threads: any.
class LargeCalls {
 public:
  enum class Kind {
    prompt,  // returns without waiting for anybody outside
    upload,  // holds what it was given until a server has answered
  };

  // bytesAtWork: of each user and kind. A message that is alone may always work.
  explicit LargeCalls(size_t bytesAtWork) : bytesAtWork_(bytesAtWork) {}

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
  // Waits for room; without a limit of time until there is some, else nothing when there was none.
  std::optional<Place> enter(uint32_t uid, Kind kind, size_t bytes,
                             std::optional<std::chrono::milliseconds> limit = std::nullopt);

 private:
  void leave(Place::Key key, size_t bytes);

  const size_t bytesAtWork_;
  std::mutex mutex_;
  std::condition_variable changed_;
  // All below guarded by mutex_.
  std::map<Place::Key, size_t> atWork_;
  size_t leftSinceTrim_ = 0;
};

}  // namespace tarnel
