#pragma once

#include <memory>
#include <optional>
#include <string>

#include "base/thread_annotations.h"
#include "base/value.h"

namespace tarnel {

class TarneldSession;

// Guards the storebag cache, the correlated sessions and every walk through the session hierarchy. Held for
// the whole of a storebag fetch. Recursive: a sync takes it again inside a walk.
class AgentLock : public RecursiveLock {};

// A session's way to the agent: the storebag cache and the other sessions.
//
// Threads: any. Whether an operation takes the agent's lock, and so waits while another session fetches a
// storebag, is said at each.
class TarneldSessionDelegate {
 public:
  TarneldSessionDelegate() = default;
  TarneldSessionDelegate(const TarneldSessionDelegate&) = delete;
  TarneldSessionDelegate& operator=(const TarneldSessionDelegate&) = delete;
  virtual ~TarneldSessionDelegate() = default;

  // storebagForSession: takes the lock. The section for the session's client type: from the cache, or
  // fetched on the calling thread. Throws InvalidArgument for a client type without a storebag name.
  virtual std::optional<Dictionary> storebagForSession(TarneldSession& session) = 0;
  // storebagVersionForSession: takes the lock. Never fetches.
  virtual MaybeString storebagVersionForSession(TarneldSession& session) = 0;
  // parentSessionIDStringForSession: takes the lock, unless the session's level is 0. The ancestors' ids, top
  // first, joined by full stops.
  virtual MaybeString parentSessionIDStringForSession(TarneldSession& session) = 0;
  // userInfoUpdatedForSession: takes the lock, unless the session has no user info. Files the session under
  // its correlation key.
  virtual void userInfoUpdatedForSession(TarneldSession& session) = 0;
  // getAncestorWithAggregatorForSession: takes no lock. The caller holds it where the session has user info
  // and stands at level 1 or more; without the one or the other nothing but the session itself is looked at,
  // and there is no ancestor. On the session's own thread: another's could see level and user info change
  // between the decision to lock and the look.
  virtual std::shared_ptr<TarneldSession> getAncestorWithAggregatorForSession(TarneldSession& session) = 0;
  // updateDownstreamSessions: takes the lock, unless the session has no user info. Re-syncs this session and
  // the deeper ones of its key.
  virtual void updateDownstreamSessions(TarneldSession& session) = 0;
  // parentSessionForChild: takes no lock; the caller holds it.
  virtual std::shared_ptr<TarneldSession> parentSessionForChild(TarneldSession& child) = 0;

  virtual AgentLock& agentLock() = 0;
  // For logs.
  virtual std::string description() const = 0;
};

}  // namespace tarnel
