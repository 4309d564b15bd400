#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <mutex>
#include <vector>

#include "tools/receiving/arrival.h"

namespace tarnel::lab {

struct ArrivalCounts {
  uint64_t posts = 0;
  uint64_t events = 0;
  uint64_t postsWithProblems = 0;
  uint64_t wireBytes = 0;   // of posts
  uint64_t plainBytes = 0;  // of posts
  uint64_t uploads = 0;
  uint64_t uploadsWithProblems = 0;
  uint64_t uploadBytes = 0;  // unpacked
  uint64_t logArchives = 0;
  uint64_t logArchivesWithProblems = 0;
  uint64_t logRecords = 0;
  uint64_t datagrams = 0;
  uint64_t datagramsWithProblems = 0;
  uint64_t datagramsOverLimit = 0;  // came too fast; not among the datagrams
  uint64_t acknowledged = 0;
  uint64_t dropped = 0;                  // on purpose
  uint64_t acknowledgementsDropped = 0;  // on purpose
};

// The newest of one kind: at most so many, and so many bytes of them. Threads: one at a time.
template <class Item>
class NewestArrivals {
 public:
  NewestArrivals(size_t keep, uint64_t maxBytes) : keep_(keep), maxBytes_(maxBytes) {}

  void add(Item item, uint64_t bytes) {
    bytes_ += bytes;
    kept_.emplace_back(std::move(item), bytes);
    while (!kept_.empty() && (kept_.size() > keep_ || bytes_ > maxBytes_)) {
      bytes_ -= kept_.front().second;
      kept_.pop_front();
    }
  }
  // Oldest of them first.
  std::vector<Item> last(size_t count) const {
    std::vector<Item> items;
    const size_t skipped = kept_.size() - std::min(count, kept_.size());
    for (size_t i = skipped; i < kept_.size(); ++i) items.push_back(kept_[i].first);
    return items;
  }
  void clear() {
    kept_.clear();
    bytes_ = 0;
  }

 private:
  const size_t keep_;
  const uint64_t maxBytes_;
  std::deque<std::pair<Item, uint64_t>> kept_;
  uint64_t bytes_ = 0;
};

// Keeps the last arrivals of each kind and tells the observers, in their order. What is read here, the
// observers have been told of. Threads: any.
class ArrivalStore {
 public:
  // What is kept of each kind goes down to the newest `keep` arrivals and to this many bytes of their plain
  // bodies.
  static constexpr uint64_t kMaxKeptBytes = 64U << 20U;

  explicit ArrivalStore(size_t keep, uint64_t maxKeptBytes = kMaxKeptBytes)
      : posts_(keep, maxKeptBytes),
        uploads_(keep, maxKeptBytes),
        logData_(keep, maxKeptBytes),
        datagrams_(keep, maxKeptBytes) {}
  ArrivalStore(const ArrivalStore&) = delete;
  ArrivalStore& operator=(const ArrivalStore&) = delete;

  // The observer outlives the store. Before the first arrival.
  void addObserver(ArrivalObserver& observer) {
    const std::lock_guard lock(telling_);
    observers_.push_back(&observer);
  }

  // Each numbers the arrival, keeps it, tells every observer and returns then.
  void add(Arrival arrival);
  void addUpload(UploadArrival arrival);
  void addLogData(LogDataArrival arrival);
  // kept: called, on this thread and before this returns, once the arrival is kept; it waits for no
  // observer. May be empty.
  void addDatagram(DatagramArrival arrival, const std::function<void()>& kept = {});
  void countDatagramOverLimit();

  // The newest, oldest of them first.
  std::vector<Arrival> last(size_t count) const;
  std::vector<UploadArrival> lastUploads(size_t count) const;
  std::vector<LogDataArrival> lastLogData(size_t count) const;
  std::vector<DatagramArrival> lastDatagrams(size_t count) const;

  // Forgets arrivals and counts; numbers go on.
  void clear();
  ArrivalCounts counts() const;

 private:
  using Telling = std::function<void(ArrivalObserver&)>;

  // Reads, with mutex_ held, when the observers have been told of everything.
  template <class Read>
  auto whenTold(Read read) const;
  void tellObservers() const;

  std::vector<ArrivalObserver*> observers_;
  mutable std::mutex telling_;  // before mutex_; held while observers are told
  mutable std::mutex mutex_;
  mutable std::deque<Telling> untold_;
  NewestArrivals<Arrival> posts_;
  NewestArrivals<UploadArrival> uploads_;
  NewestArrivals<LogDataArrival> logData_;
  NewestArrivals<DatagramArrival> datagrams_;
  uint64_t postNumber_ = 0;
  uint64_t uploadNumber_ = 0;
  uint64_t logDataNumber_ = 0;
  uint64_t datagramNumber_ = 0;
  ArrivalCounts counts_;
};

}  // namespace tarnel::lab
