#pragma once

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "backends/tarnel_backend.h"
#include "base/thread_annotations.h"
#include "session/backend_set.h"

namespace tarnel {

// What the sessions of one hierarchy see and change of one another.
//
// A session's backends take no lock and belong to the thread of that session's connection; yet a walk through
// the hierarchy, on the thread of another session, looks at their reporting and changes it. This object
// stands between the two. Its owner publishes here what the walks may see. A state is changed in place (it is
// atomic) and so holds at once for everybody. What a backend keeps for itself (its sampling threshold, the
// identifier under which it labels its events) is noted here and applied by the owner's thread before it
// next uses its backends; no backend sends anything before that.
//
// Threads: operations marked "owner" are for the session's own thread, the others for any. The lock within is
// a leaf: it may be taken under the agent's lock, nothing is taken or called under it, and nobody waits for
// it longer than a few assignments take.
class SharedReporting {
 public:
  // One backend as the other sessions see it.
  struct Report {
    std::string name;
    std::shared_ptr<TarnelBackend> backend;  // of which only the state is for any thread
    int32_t hierarchy = 0;
    std::optional<Value> samplingThreshold;
  };

  SharedReporting() = default;
  SharedReporting(const SharedReporting&) = delete;
  SharedReporting& operator=(const SharedReporting&) = delete;

  // Owner: makes these backends the session's; what was noted for those before them is void.
  void replaceBackends(const BackendSet& backends);
  // Owner: shows what the backends have just decided on their own. Thresholds noted before that are void.
  void publish(const BackendSet& backends);
  // Owner: applies what other threads noted, to each backend whatever another comes to. Costs one atomic read
  // when there is nothing.
  void applyNotes(Log& log, const BackendSet& backends);
  // Owner: shows the user info. The stored copy shares its storage with the argument.
  void setUserInfo(const MaybeDictionary& userInfo);

  MaybeDictionary userInfo() const;
  // Of the HTTPPost2 backend, else of the HTTPPost backend, else 0.
  int32_t hierarchy() const noexcept { return hierarchy_.load(std::memory_order_relaxed); }
  std::vector<Report> reports() const;

  void noteSamplingThreshold(std::string_view name, const std::optional<Value>& threshold);
  void noteCorrelatedSessionID(std::string correlatedSessionID);

 private:
  static std::vector<Report> reportsOf(const BackendSet& backends);
  static int32_t hierarchyOf(const BackendSet& backends);

  class TARNEL_CAPABILITY("mutex") LeafLock {
   public:
    void lock() TARNEL_ACQUIRE() { mutex_.lock(); }
    void unlock() TARNEL_RELEASE() { mutex_.unlock(); }

   private:
    std::mutex mutex_;
  };

  mutable LeafLock lock_;
  std::vector<Report> reports_ TARNEL_GUARDED_BY(lock_);
  MaybeDictionary userInfo_ TARNEL_GUARDED_BY(lock_);
  std::map<std::string, std::optional<Value>, std::less<>> notedThresholds_ TARNEL_GUARDED_BY(lock_);
  MaybeString notedCorrelatedSessionID_ TARNEL_GUARDED_BY(lock_);
  std::atomic<bool> noted_{false};
  std::atomic<int32_t> hierarchy_{0};
};

}  // namespace tarnel
