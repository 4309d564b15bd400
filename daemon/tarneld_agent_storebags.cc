// The storebag cache: one entry per storebag name, shared by all client types of that name.

#include <cmath>
#include <cstdlib>
#include <utility>

#include "daemon/tarneld_agent.h"
#include "tarnel/keys.h"
#include "util/storebag.h"

namespace tarnel {
namespace {

int32_t clientTypeOf(const TarneldSession& session) {
  const MaybeDictionary& info = session.sessionInfo();
  const Value* clientType = info ? info->find(kTarnelSessionInfoClientType) : nullptr;
  return clientType != nullptr ? clientType->int32Value() : 0;
}

// Seconds between the last attempt and now. A clock that was set back counts by magnitude.
double ageOf(const StorebagCacheEntry& entry, const Date& now) {
  return entry.StorebagFetchTime ? std::abs(entry.StorebagFetchTime->seconds - now.seconds) : 0.0;
}

// Writes down what a fetch came to, also when it unwinds.
class FetchRecord {
 public:
  FetchRecord(Clock& clock, StorebagCacheEntry& entry)
      : clock_(clock), entry_(entry), lastModified_(entry.StorebagLastModified) {}
  FetchRecord(const FetchRecord&) = delete;
  FetchRecord& operator=(const FetchRecord&) = delete;
  ~FetchRecord() {
    entry_.StorebagFetchTime = Date{secondsFromTimeValue(clock_.timeOfDay())};
    entry_.StorebagFetchState = successful_ ? StorebagCacheEntry::kSuccessful : StorebagCacheEntry::kFailure;
    entry_.StorebagMaxAge = maxAge_;
    if (lastModified_) entry_.StorebagLastModified = std::move(lastModified_);
  }

  StorebagFetchSlots slots() { return {maxAge_, version_, notModified_, &lastModified_}; }
  int32_t maxAge() const noexcept { return maxAge_; }
  bool notModified() const noexcept { return notModified_; }
  MaybeString takeVersion() { return std::move(version_); }
  void setSuccessful() noexcept { successful_ = true; }

 private:
  Clock& clock_;
  StorebagCacheEntry& entry_;
  int32_t maxAge_ = 0;
  MaybeString version_;
  bool notModified_ = false;
  MaybeString lastModified_;
  bool successful_ = false;
};

}  // namespace

std::optional<Dictionary> TarneldAgent::storebagForSession(TarneldSession& session) {
  Log& log = dependencies_.log;
  const int32_t clientType = clientTypeOf(session);
  const MaybeString name = storebagNameForClientType(clientType);
  TARNEL_LOG(log, debug, "storebagForSession: Retrieving storebag for session %u with client type %d",
             session.sessionID(), clientType);
  const LockGuard guard(_lock);
  const auto entry = name ? _cachedStorebags.find(*name) : _cachedStorebags.end();
  if (entry != _cachedStorebags.end()) {
    const double age = ageOf(entry->second, Date{secondsFromTimeValue(dependencies_.clock.timeOfDay())});
    const bool ok = entry->second.StorebagFetchState == StorebagCacheEntry::kSuccessful;
    if (ok && age < static_cast<double>(entry->second.StorebagMaxAge)) {
      TARNEL_LOG(log, debug, "storebagForSession: Cached storebag found for client type %d", clientType);
      return entry->second.StorebagData;
    }
    if (!ok && age < static_cast<double>(kStorebagRetrySeconds)) {
      TARNEL_LOG(log, information,
                 "storebagForSession: Not fetching storebag for client type %d - must wait %d seconds "
                 "between attempts",
                 clientType, kStorebagRetrySeconds);
      return entry->second.StorebagData;
    }
  }
  fetchAndCacheStorebag(clientType);
  const auto fetched = name ? _cachedStorebags.find(*name) : _cachedStorebags.end();
  return fetched != _cachedStorebags.end() ? fetched->second.StorebagData : std::nullopt;
}

void TarneldAgent::fetchAndCacheStorebag(int32_t clientType) {
  Log& log = dependencies_.log;
  TARNEL_LOG(log, debug, "fetchAndCacheStorebag: Fetching storebag for client type %d", clientType);
  const MaybeString name = storebagNameForClientType(clientType);
  if (!name) {
    throw InvalidArgument("client type " + std::to_string(clientType) +
                          " has no storebag: set \"clientType\" in the session info to 5 to 17");
  }
  StorebagCacheEntry& entry = _cachedStorebags[*name];
  FetchRecord record(dependencies_.clock, entry);
  auto storebag = storebagFetcher_(dependencies_, clientType, record.slots());
  TARNEL_LOG(log, debug, "fetchAndCacheStorebag: Storebag max age: %d seconds", record.maxAge());
  if (storebag) {
    entry.StorebagData = std::move(storebag);
    entry.StorebagVersion = record.takeVersion();
    record.setSuccessful();
  } else if (record.notModified()) {
    record.setSuccessful();
  } else {
    TARNEL_LOG(log, error, "fetchAndCacheStorebag: Unable to fetch storebag for client type %d", clientType);
  }
}

MaybeString TarneldAgent::storebagVersionForSession(TarneldSession& session) {
  const MaybeString name = storebagNameForClientType(clientTypeOf(session));
  const LockGuard guard(_lock);
  const auto entry = name ? _cachedStorebags.find(*name) : _cachedStorebags.end();
  return entry != _cachedStorebags.end() ? entry->second.StorebagVersion : std::nullopt;
}

std::unordered_map<std::string, StorebagCacheEntry> TarneldAgent::cachedStorebags() {
  const LockGuard guard(_lock);
  return _cachedStorebags;
}

}  // namespace tarnel
