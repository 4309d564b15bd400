#include "tools/lab/arrival_store.h"

#include <algorithm>

namespace tarnel::lab {

void ArrivalStore::add(Arrival arrival) {
  const std::lock_guard lock(mutex_);
  arrival.number = ++number_;
  ++counts_.posts;
  counts_.events += arrival.events.size();
  counts_.postsWithProblems += arrival.problems.empty() ? 0U : 1U;
  counts_.wireBytes += arrival.wireBytes;
  counts_.plainBytes += arrival.plainBytes;
  for (ArrivalObserver* observer : observers_) observer->arrived(arrival);
  keptBytes_ += arrival.plainBytes;
  kept_.push_back(std::move(arrival));
  while (!kept_.empty() && (kept_.size() > keep_ || keptBytes_ > maxKeptBytes_)) {
    keptBytes_ -= kept_.front().plainBytes;
    kept_.pop_front();
  }
}

std::vector<Arrival> ArrivalStore::last(size_t count) const {
  const std::lock_guard lock(mutex_);
  const auto begin = kept_.end() - static_cast<ptrdiff_t>(std::min(count, kept_.size()));
  return {begin, kept_.end()};
}

void ArrivalStore::clear() {
  const std::lock_guard lock(mutex_);
  kept_.clear();
  keptBytes_ = 0;
  counts_ = {};
}

ArrivalCounts ArrivalStore::counts() const {
  const std::lock_guard lock(mutex_);
  return counts_;
}

}  // namespace tarnel::lab
