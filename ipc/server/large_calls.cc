#include "ipc/server/large_calls.h"

#include <malloc.h>

namespace tarnel {

void LargeCalls::trimHeap() {
  ::malloc_trim(0);
}

std::optional<LargeCalls::Place> LargeCalls::enter(uint32_t uid, Kind kind, size_t bytes,
                                                   std::chrono::milliseconds limit) {
  const Place::Key key{uid, kind};
  std::unique_lock lock(mutex_);
  if (stopped_) return std::nullopt;
  Line& line = lines_[key];
  if (line.waiting.empty() && fits(line, bytes)) {
    line.atWork += bytes;
    return Place(*this, key, bytes);
  }
  Waiting self(bytes);
  const auto place = line.waiting.insert(line.waiting.end(), &self);
  self.changed.wait_for(lock, limit, [this, &self] { return self.entered || stopped_; });
  if (self.entered) return Place(*this, key, bytes);
  line.waiting.erase(place);
  // Those behind it may be smaller.
  admitWaiting(line);
  removeIfUnused(key);
  return std::nullopt;
}

void LargeCalls::stop() {
  const std::lock_guard lock(mutex_);
  stopped_ = true;
  for (auto& [key, line] : lines_) {
    for (auto* waiting : line.waiting) waiting->changed.notify_one();
  }
}

bool LargeCalls::stopped() const {
  const std::lock_guard lock(mutex_);
  return stopped_;
}

size_t LargeCalls::waiting(uint32_t uid, Kind kind) const {
  const std::lock_guard lock(mutex_);
  const auto found = lines_.find({uid, kind});
  return found == lines_.end() ? 0 : found->second.waiting.size();
}

bool LargeCalls::fits(const Line& line, size_t bytes) const {
  return line.atWork == 0 || line.atWork + bytes <= bytesAtWork_;
}

void LargeCalls::admitWaiting(Line& line) {
  while (!stopped_ && !line.waiting.empty() && fits(line, line.waiting.front()->bytes)) {
    Waiting& first = *line.waiting.front();
    line.waiting.pop_front();
    line.atWork += first.bytes;
    first.entered = true;
    first.changed.notify_one();
  }
}

void LargeCalls::removeIfUnused(Place::Key key) {
  const auto found = lines_.find(key);
  if (found->second.atWork == 0 && found->second.waiting.empty()) lines_.erase(found);
}

bool LargeCalls::isTrimOwed() const {
  return lines_.empty() && leftSinceTrim_ >= bytesAtWork_;
}

std::optional<std::chrono::milliseconds> LargeCalls::trimOwed() {
  {
    const std::lock_guard lock(mutex_);
    if (!isTrimOwed()) return std::nullopt;
    const auto now = heap_.now();
    if (lastTrim_ && now - *lastTrim_ < kTrimEvery) {
      return std::chrono::ceil<std::chrono::milliseconds>(*lastTrim_ + kTrimEvery - now);
    }
    lastTrim_ = now;
    leftSinceTrim_ = 0;
  }
  heap_.trim();
  return std::nullopt;
}

void LargeCalls::leave(Place::Key key, size_t bytes) {
  bool isOwed = false;
  {
    const std::lock_guard lock(mutex_);
    Line& line = lines_.find(key)->second;
    line.atWork -= bytes;
    leftSinceTrim_ += bytes;
    admitWaiting(line);
    removeIfUnused(key);
    isOwed = isTrimOwed();
  }
  if (isOwed) heap_.owed();
}

}  // namespace tarnel
