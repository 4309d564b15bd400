#include "tools/lab/arrival_store.h"

namespace tarnel::lab {
namespace {

// Of an arrival that holds no body: what its texts come to, roughly.
constexpr uint64_t kDescriptionBytes = 4096;

uint64_t oneIf(bool condition) {
  return condition ? 1 : 0;
}

}  // namespace

void ArrivalStore::add(Arrival arrival) {
  const std::lock_guard lock(mutex_);
  arrival.number = ++postNumber_;
  ++counts_.posts;
  counts_.events += arrival.events.size();
  counts_.postsWithProblems += oneIf(!arrival.problems.empty());
  counts_.wireBytes += arrival.wireBytes;
  counts_.plainBytes += arrival.plainBytes;
  for (ArrivalObserver* observer : observers_) observer->arrived(arrival);
  const uint64_t bytes = arrival.plainBytes;
  posts_.add(std::move(arrival), bytes);
}

void ArrivalStore::addUpload(UploadArrival arrival) {
  const std::lock_guard lock(mutex_);
  arrival.number = ++uploadNumber_;
  ++counts_.uploads;
  counts_.uploadsWithProblems += oneIf(!arrival.problems.empty());
  counts_.uploadBytes += arrival.plainBytes;
  for (ArrivalObserver* observer : observers_) observer->uploadArrived(arrival);
  uploads_.add(std::move(arrival), kDescriptionBytes);
}

void ArrivalStore::addLogData(LogDataArrival arrival) {
  const std::lock_guard lock(mutex_);
  arrival.number = ++logDataNumber_;
  ++counts_.logArchives;
  counts_.logArchivesWithProblems += oneIf(!arrival.problems.empty());
  counts_.logRecords += arrival.records.size();
  for (ArrivalObserver* observer : observers_) observer->logDataArrived(arrival);
  const uint64_t bytes = arrival.plainBytes + kDescriptionBytes;
  logData_.add(std::move(arrival), bytes);
}

void ArrivalStore::addDatagram(DatagramArrival arrival) {
  const std::lock_guard lock(mutex_);
  arrival.number = ++datagramNumber_;
  ++counts_.datagrams;
  counts_.datagramsWithProblems += oneIf(!arrival.problems.empty());
  counts_.acknowledged += oneIf(arrival.answer == DatagramAnswer::acknowledged);
  counts_.dropped += oneIf(arrival.answer == DatagramAnswer::dropped);
  counts_.acknowledgementsDropped += oneIf(arrival.answer == DatagramAnswer::acknowledgementDropped);
  for (ArrivalObserver* observer : observers_) observer->datagramArrived(arrival);
  datagrams_.add(std::move(arrival), kDescriptionBytes);
}

void ArrivalStore::countDatagramOverLimit() {
  const std::lock_guard lock(mutex_);
  ++counts_.datagramsOverLimit;
}

std::vector<Arrival> ArrivalStore::last(size_t count) const {
  const std::lock_guard lock(mutex_);
  return posts_.last(count);
}

std::vector<UploadArrival> ArrivalStore::lastUploads(size_t count) const {
  const std::lock_guard lock(mutex_);
  return uploads_.last(count);
}

std::vector<LogDataArrival> ArrivalStore::lastLogData(size_t count) const {
  const std::lock_guard lock(mutex_);
  return logData_.last(count);
}

std::vector<DatagramArrival> ArrivalStore::lastDatagrams(size_t count) const {
  const std::lock_guard lock(mutex_);
  return datagrams_.last(count);
}

void ArrivalStore::clear() {
  const std::lock_guard lock(mutex_);
  posts_.clear();
  uploads_.clear();
  logData_.clear();
  datagrams_.clear();
  counts_ = {};
}

ArrivalCounts ArrivalStore::counts() const {
  const std::lock_guard lock(mutex_);
  return counts_;
}

}  // namespace tarnel::lab
