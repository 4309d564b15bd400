#include "session/shared_reporting.h"

#include <algorithm>
#include <utility>

#include "tarnel/keys.h"

namespace tarnel {

std::vector<SharedReporting::Report> SharedReporting::reportsOf(const BackendSet& backends) {
  std::vector<Report> reports;
  reports.reserve(backends.size());
  for (const auto& [name, backend] : backends) {
    reports.push_back({name, backend, backend->hierarchy(), backend->samplingThreshold()});
  }
  return reports;
}

int32_t SharedReporting::hierarchyOf(const BackendSet& backends) {
  for (const char* name : {kTarnelBackendHTTPPost2, kTarnelBackendHTTPPost}) {
    if (const TarnelBackend* backend = backends.find(name)) return backend->hierarchy();
  }
  return 0;
}

void SharedReporting::replaceBackends(const BackendSet& backends) {
  std::vector<Report> reports = reportsOf(backends);
  {
    const LockGuard guard(lock_);
    reports_.swap(reports);
    notedThresholds_.clear();
    notedCorrelatedSessionID_.reset();
    noted_.store(false, std::memory_order_relaxed);
  }
  hierarchy_.store(hierarchyOf(backends), std::memory_order_relaxed);
}

void SharedReporting::publish(const BackendSet& backends) {
  std::vector<Report> reports = reportsOf(backends);
  {
    const LockGuard guard(lock_);
    reports_.swap(reports);
    notedThresholds_.clear();
  }
  hierarchy_.store(hierarchyOf(backends), std::memory_order_relaxed);
}

void SharedReporting::applyNotes(Log& log, const BackendSet& backends) {
  if (!noted_.load(std::memory_order_acquire)) return;
  std::map<std::string, std::optional<Value>, std::less<>> thresholds;
  MaybeString correlatedSessionID;
  {
    const LockGuard guard(lock_);
    thresholds.swap(notedThresholds_);
    correlatedSessionID.swap(notedCorrelatedSessionID_);
    noted_.store(false, std::memory_order_relaxed);
  }
  withEach(log, "applyNotes", backends,
           [&thresholds, &correlatedSessionID](const std::string& name, TarnelBackend& each) {
             const auto threshold = thresholds.find(name);
             if (threshold != thresholds.end()) each.setSamplingThreshold(threshold->second);
             if (correlatedSessionID) each.setCorrelatedSessionID(correlatedSessionID);
           });
}

void SharedReporting::setUserInfo(const MaybeDictionary& userInfo) {
  MaybeDictionary copy = userInfo;
  const LockGuard guard(lock_);
  userInfo_.swap(copy);
}

MaybeDictionary SharedReporting::userInfo() const {
  const LockGuard guard(lock_);
  return userInfo_;
}

std::vector<SharedReporting::Report> SharedReporting::reports() const {
  const LockGuard guard(lock_);
  return reports_;
}

void SharedReporting::noteSamplingThreshold(std::string_view name, const std::optional<Value>& threshold) {
  const LockGuard guard(lock_);
  const auto report = std::find_if(reports_.begin(), reports_.end(),
                                   [name](const Report& candidate) { return candidate.name == name; });
  if (report == reports_.end()) return;
  report->samplingThreshold = threshold;
  notedThresholds_.insert_or_assign(std::string(name), threshold);
  noted_.store(true, std::memory_order_release);
}

void SharedReporting::noteCorrelatedSessionID(std::string correlatedSessionID) {
  const LockGuard guard(lock_);
  if (reports_.empty()) return;
  notedCorrelatedSessionID_ = std::move(correlatedSessionID);
  noted_.store(true, std::memory_order_release);
}

}  // namespace tarnel
