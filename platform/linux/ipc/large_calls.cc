#include "platform/linux/ipc/large_calls.h"

#include <malloc.h>

namespace tarnel {

std::optional<LargeCalls::Place> LargeCalls::enter(uint32_t uid, Kind kind, size_t bytes,
                                                   std::optional<std::chrono::milliseconds> limit) {
  const Place::Key key{uid, kind};
  std::unique_lock lock(mutex_);
  const auto hasRoom = [this, key, bytes] {
    const auto found = atWork_.find(key);
    return found == atWork_.end() || found->second + bytes <= bytesAtWork_;
  };
  if (!limit) {
    changed_.wait(lock, hasRoom);
  } else if (!changed_.wait_for(lock, *limit, hasRoom)) {
    return std::nullopt;
  }
  atWork_[key] += bytes;
  return Place(*this, key, bytes);
}

void LargeCalls::leave(Place::Key key, size_t bytes) {
  bool isTrimDue = false;
  {
    const std::lock_guard lock(mutex_);
    const auto found = atWork_.find(key);
    found->second -= bytes;
    if (found->second == 0) atWork_.erase(found);
    leftSinceTrim_ += bytes;
    isTrimDue = leftSinceTrim_ >= bytesAtWork_;
    if (isTrimDue) leftSinceTrim_ = 0;
    changed_.notify_all();
  }
  // The C library keeps what small values took, for every thread anew.
  if (isTrimDue) ::malloc_trim(0);
}

}  // namespace tarnel
