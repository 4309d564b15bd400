#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "ipc/ipc.h"
#include "session/backend_set.h"
#include "session/tarneld_session.h"
#include "session/tarneld_session_delegate.h"
#include "util/dependencies.h"
#include "util/storebag.h"

namespace tarnel {

// Guards the list of live sessions and the keep-alive transaction. Never held while anything else is taken.
class SessionListLock : public RecursiveLock {};

// Seconds that must lie between a failed storebag fetch and the next.
inline constexpr int32_t kStorebagRetrySeconds = 900;

// Fetches one section. fetchStorebagForEnvironmentAndClientType everywhere but in tests.
using StorebagFetcher = std::function<std::optional<Dictionary>(
    const Dependencies& dependencies, int32_t clientType, StorebagFetchSlots slots)>;

// What the daemon knows of one storebag. Members are absent until a fetch has said something about them.
struct StorebagCacheEntry {
  static constexpr char kSuccessful[] = "Fetch Successful";
  static constexpr char kFailure[] = "Fetch Failure";

  std::optional<Dictionary> StorebagData;  // the section of the last success; kept across failures
  MaybeString StorebagVersion;             // version of that section
  MaybeString StorebagLastModified;        // "Last-Modified" as last seen
  std::optional<Date> StorebagFetchTime;   // of the last attempt, whatever came of it
  MaybeString StorebagFetchState;          // one of the two texts above
  int32_t StorebagMaxAge = 0;              // seconds for which a success stays valid
};

// The one agent of the process: decides which connections are let in, keeps the list of live sessions, holds
// the process open while there is one, and is the sessions' only way to the storebag cache and to one
// another.
//
// Threads: any. shouldAcceptNewConnection takes only the list's lock, also for a connection that cannot be
// served, and so never waits for a storebag fetch, which holds the agent's lock for up to 15 seconds. Who
// takes the agent's lock waits for one: the operations of TarneldSessionDelegate that say so, and the end of
// an accepted connection; all of these run on connections' threads, never on the one that accepts. The two
// locks are never held together.
class TarneldAgent final : public IpcListenerDelegate,
                           public TarneldSessionDelegate,
                           public std::enable_shared_from_this<TarneldAgent> {
  struct Key {
    explicit Key() = default;
  };

 public:
  // Lists without sessions are let go once the keys of all lists together outgrow this.
  static constexpr size_t kCorrelationKeyBytes = 1U << 20U;

  // init
  // dependencies: by reference; must outlive the agent and every session. backendFactory: for the
  // sessions.
  static std::shared_ptr<TarneldAgent> init(
      const Dependencies& dependencies, BackendFactory backendFactory = &TarnelBackend::newBackendWithName,
      StorebagFetcher storebagFetcher = &fetchStorebagForEnvironmentAndClientType);
  TarneldAgent(Key key, const Dependencies& dependencies, BackendFactory backendFactory,
               StorebagFetcher storebagFetcher);

  // IpcListenerDelegate. The session's invalidation handler keeps agent and session alive until it ran.
  bool shouldAcceptNewConnection(IpcListener& listener, std::shared_ptr<IpcConnection> connection) override;

  // TarneldSessionDelegate.
  std::optional<Dictionary> storebagForSession(TarneldSession& session) override;
  MaybeString storebagVersionForSession(TarneldSession& session) override;
  MaybeString parentSessionIDStringForSession(TarneldSession& session) override;
  void userInfoUpdatedForSession(TarneldSession& session) override;
  std::shared_ptr<TarneldSession> getAncestorWithAggregatorForSession(TarneldSession& session) override;
  void updateDownstreamSessions(TarneldSession& session) override;
  std::shared_ptr<TarneldSession> parentSessionForChild(TarneldSession& child) override;
  AgentLock& agentLock() override { return _lock; }
  std::string description() const override { return "<TarneldAgent>"; }

  // For tests and reports: copies of the collections as they are at this moment.
  std::vector<std::shared_ptr<TarneldSession>> sessionList();
  std::unordered_map<std::string, StorebagCacheEntry> cachedStorebags();
  std::unordered_map<std::string, std::vector<std::shared_ptr<TarneldSession>>> correlatedSessions();

 private:
  class ListEntry;
  using SessionList = std::vector<std::shared_ptr<TarneldSession>>;

  void connectionInvalidated(const std::shared_ptr<TarneldSession>& session);
  void addSession(const std::shared_ptr<TarneldSession>& session);
  void removeSession(const TarneldSession& session);
  size_t sessionCount();

  // fetchAndCacheStorebag:
  void fetchAndCacheStorebag(int32_t clientType) TARNEL_REQUIRES(_lock);

  // The session's list, null when there is none or it is empty. Valid until the lists change.
  const SessionList* correlatedList(const std::string& key) const TARNEL_REQUIRES(_lock);
  SessionList& correlatedListForAdding(const std::string& key) TARNEL_REQUIRES(_lock);
  void removeFromCorrelatedSessions(const TarneldSession& session) TARNEL_REQUIRES(_lock);
  void dropEmptyLists() TARNEL_REQUIRES(_lock);

  const Dependencies& dependencies_;
  const BackendFactory backendFactory_;
  const StorebagFetcher storebagFetcher_;

  SessionListLock _sessionListLock;
  SessionList _sessionList TARNEL_GUARDED_BY(_sessionListLock);

  AgentLock _lock;
  std::unordered_map<std::string, StorebagCacheEntry> _cachedStorebags TARNEL_GUARDED_BY(_lock);
  std::unordered_map<std::string, SessionList> _correlatedSessions TARNEL_GUARDED_BY(_lock);
  // Under which key a session is filed; a client may change its names between filing and going.
  std::unordered_map<const TarneldSession*, std::string> filedUnder_ TARNEL_GUARDED_BY(_lock);
  size_t correlationKeyBytes_ TARNEL_GUARDED_BY(_lock) = 0;
  // Number of keys in _correlatedSessions, for whoever must not wait for the lock.
  std::atomic<size_t> correlationKeys_{0};
};

}  // namespace tarnel
