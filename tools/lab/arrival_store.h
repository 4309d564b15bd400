#pragma once

#include <cstdint>
#include <deque>
#include <mutex>
#include <vector>

#include "tools/lab/arrival.h"

namespace tarnel::lab {

struct ArrivalCounts {
  uint64_t posts = 0;
  uint64_t events = 0;
  uint64_t postsWithProblems = 0;
  uint64_t wireBytes = 0;
  uint64_t plainBytes = 0;
};

// Keeps the last arrivals and tells the observers. Threads: any.
class ArrivalStore {
 public:
  // What is kept goes down to the newest `keep` arrivals and to this many bytes of their plain bodies.
  static constexpr uint64_t kMaxKeptBytes = 64U << 20U;

  explicit ArrivalStore(size_t keep, uint64_t maxKeptBytes = kMaxKeptBytes)
      : keep_(keep), maxKeptBytes_(maxKeptBytes) {}
  ArrivalStore(const ArrivalStore&) = delete;
  ArrivalStore& operator=(const ArrivalStore&) = delete;

  // The observer outlives the store. Before the first arrival.
  void addObserver(ArrivalObserver& observer) { observers_.push_back(&observer); }

  // Numbers the arrival, keeps it and tells every observer.
  void add(Arrival arrival);
  // The newest, oldest of them first.
  std::vector<Arrival> last(size_t count) const;
  // Forgets arrivals and counts; numbers go on.
  void clear();
  ArrivalCounts counts() const;

 private:
  const size_t keep_;
  const uint64_t maxKeptBytes_;
  std::vector<ArrivalObserver*> observers_;
  mutable std::mutex mutex_;
  std::deque<Arrival> kept_;
  uint64_t keptBytes_ = 0;
  uint64_t number_ = 0;
  ArrivalCounts counts_;
};

}  // namespace tarnel::lab
