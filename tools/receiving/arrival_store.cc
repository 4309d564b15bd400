#include "tools/receiving/arrival_store.h"

namespace tarnel::lab {
namespace {

// Of an arrival that holds no body: what its texts come to, roughly.
constexpr uint64_t kDescriptionBytes = 4096;

uint64_t oneIf(bool condition) {
  return condition ? 1 : 0;
}

}  // namespace

template <class Read>
auto ArrivalStore::whenTold(Read read) const {
  const std::lock_guard telling(telling_);
  for (;;) {
    Telling next;
    {
      const std::lock_guard lock(mutex_);
      if (untold_.empty()) return read();
      next = std::move(untold_.front());
      untold_.pop_front();
    }
    for (ArrivalObserver* observer : observers_) next(*observer);
  }
}

void ArrivalStore::tellObservers() const {
  whenTold([] {});
}

void ArrivalStore::add(Arrival arrival) {
  {
    const std::lock_guard lock(mutex_);
    arrival.number = ++postNumber_;
    ++counts_.posts;
    counts_.events += arrival.events.size();
    counts_.postsWithProblems += oneIf(!arrival.problems.empty());
    counts_.wireBytes += arrival.wireBytes;
    counts_.plainBytes += arrival.plainBytes;
    untold_.emplace_back([arrival](ArrivalObserver& observer) { observer.arrived(arrival); });
    const uint64_t bytes = arrival.plainBytes;
    posts_.add(std::move(arrival), bytes);
  }
  tellObservers();
}

void ArrivalStore::addUpload(UploadArrival arrival) {
  {
    const std::lock_guard lock(mutex_);
    arrival.number = ++uploadNumber_;
    ++counts_.uploads;
    counts_.uploadsWithProblems += oneIf(!arrival.problems.empty());
    counts_.uploadBytes += arrival.plainBytes;
    untold_.emplace_back([arrival](ArrivalObserver& observer) { observer.uploadArrived(arrival); });
    uploads_.add(std::move(arrival), kDescriptionBytes);
  }
  tellObservers();
}

void ArrivalStore::addLogData(LogDataArrival arrival) {
  {
    const std::lock_guard lock(mutex_);
    arrival.number = ++logDataNumber_;
    ++counts_.logArchives;
    counts_.logArchivesWithProblems += oneIf(!arrival.problems.empty());
    counts_.logRecords += arrival.records.size();
    untold_.emplace_back([arrival](ArrivalObserver& observer) { observer.logDataArrived(arrival); });
    const uint64_t bytes = arrival.plainBytes + kDescriptionBytes;
    logData_.add(std::move(arrival), bytes);
  }
  tellObservers();
}

void ArrivalStore::addDatagram(DatagramArrival arrival, const std::function<void()>& kept) {
  {
    const std::lock_guard lock(mutex_);
    arrival.number = ++datagramNumber_;
    ++counts_.datagrams;
    counts_.datagramsWithProblems += oneIf(!arrival.problems.empty());
    counts_.acknowledged += oneIf(arrival.answer == DatagramAnswer::acknowledged);
    counts_.dropped += oneIf(arrival.answer == DatagramAnswer::dropped);
    counts_.acknowledgementsDropped += oneIf(arrival.answer == DatagramAnswer::acknowledgementDropped);
    untold_.emplace_back([arrival](ArrivalObserver& observer) { observer.datagramArrived(arrival); });
    datagrams_.add(std::move(arrival), kDescriptionBytes);
  }
  if (kept) kept();
  tellObservers();
}

void ArrivalStore::countDatagramOverLimit() {
  const std::lock_guard lock(mutex_);
  ++counts_.datagramsOverLimit;
}

std::vector<Arrival> ArrivalStore::last(size_t count) const {
  return whenTold([this, count] { return posts_.last(count); });
}

std::vector<UploadArrival> ArrivalStore::lastUploads(size_t count) const {
  return whenTold([this, count] { return uploads_.last(count); });
}

std::vector<LogDataArrival> ArrivalStore::lastLogData(size_t count) const {
  return whenTold([this, count] { return logData_.last(count); });
}

std::vector<DatagramArrival> ArrivalStore::lastDatagrams(size_t count) const {
  return whenTold([this, count] { return datagrams_.last(count); });
}

void ArrivalStore::clear() {
  whenTold([this] {
    posts_.clear();
    uploads_.clear();
    logData_.clear();
    datagrams_.clear();
    counts_ = {};
  });
}

ArrivalCounts ArrivalStore::counts() const {
  return whenTold([this] { return counts_; });
}

}  // namespace tarnel::lab
