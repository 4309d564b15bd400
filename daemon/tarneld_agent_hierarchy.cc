// The session hierarchy: sessions of one user activity share a correlation key and stand at levels.

#include <algorithm>
#include <utility>

#include "daemon/hierarchy_walks.h"
#include "daemon/tarneld_agent.h"
#include "util/device_facts.h"

namespace tarnel {
namespace {

bool lists(const std::vector<std::shared_ptr<TarneldSession>>& sessionList, const TarneldSession& session) {
  return std::any_of(
      sessionList.begin(), sessionList.end(),
      [&session](const std::shared_ptr<TarneldSession>& candidate) { return candidate.get() == &session; });
}

}  // namespace

void TarneldAgent::userInfoUpdatedForSession(TarneldSession& session) {
  Log& log = dependencies_.log;
  const MaybeDictionary userInfo = session.userInfo();
  if (!userInfo) {
    TARNEL_LOG(log, information, "userInfoUpdatedForSession: No user info found for session %u",
               session.sessionID());
    return;
  }
  const std::string key = userInfoKey(userInfo);
  const LockGuard guard(_lock);
  removeFromCorrelatedSessions(session);
  SessionList& list = correlatedListForAdding(key);
  TARNEL_LOG(log, debug, "userInfoUpdatedForSession: Adding session %u to list for userInfoKey %s",
             session.sessionID(), key.c_str());
  list.push_back(session.shared_from_this());
  filedUnder_.emplace(&session, key);
}

std::shared_ptr<TarneldSession> TarneldAgent::parentSessionForChild(TarneldSession& child)
    TARNEL_NO_THREAD_SAFETY_ANALYSIS {
  Log& log = dependencies_.log;
  const int32_t level = child.getSessionHierarchy();
  if (level == 0) return nullptr;
  const std::string key = userInfoKey(child.userInfo());
  TARNEL_LOG(log, debug, "parentSessionForChild: Checking userInfoKey '%s' for session %u", key.c_str(),
             child.sessionID());
  const SessionList* list = correlatedList(key);
  if (list == nullptr) {
    TARNEL_LOG(log, error, "parentSessionForChild: ERROR: No sessions found for user info key %s",
               key.c_str());
    return nullptr;
  }
  if (!lists(*list, child)) {
    TARNEL_LOG(log, error, "parentSessionForChild: ERROR: Session %u not found for user info key %s",
               child.sessionID(), key.c_str());
    return nullptr;
  }
  auto parent = getFirstSessionWithHierarchy(int64_t{level} - 1, firstOfLevelsBeside(child, *list));
  if (parent == nullptr) {
    TARNEL_LOG(log, information,
               "parentSessionForChild: Unable to find session with hierarchy of %d for userInfoKey '%s'",
               static_cast<int32_t>(int64_t{level} - 1), key.c_str());
  }
  return parent;
}

MaybeString TarneldAgent::parentSessionIDStringForSession(TarneldSession& session) {
  Log& log = dependencies_.log;
  const int32_t hierarchy = session.getSessionHierarchy();
  if (hierarchy == 0) return std::nullopt;
  const LockGuard guard(_lock);
  const std::string key = userInfoKey(session.userInfo());
  TARNEL_LOG(log, debug, "parentSessionIDStringForSession: Checking userInfoKey '%s' for session %u",
             key.c_str(), session.sessionID());
  const SessionList* list = correlatedList(key);
  if (list == nullptr) {
    TARNEL_LOG(log, error, "parentSessionIDStringForSession: ERROR: No sessions found for user info key %s",
               key.c_str());
    return std::nullopt;
  }
  if (!lists(*list, session)) {
    TARNEL_LOG(log, error,
               "parentSessionIDStringForSession: ERROR: Session %u not found for user info key %s",
               session.sessionID(), key.c_str());
    return std::nullopt;
  }
  const auto others = firstOfLevelsBeside(session, *list);
  MaybeString text;
  for (int64_t level = int64_t{hierarchy} - 1; level >= 0; --level) {
    const auto ancestor = getFirstSessionWithHierarchy(level, others);
    if (ancestor == nullptr) {
      TARNEL_LOG(log, information,
                 "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): "
                 "incomplete parentSessionID is '%s'",
                 printable(text));
      return text;
    }
    text = text ? ancestor->sessionIDString() + "." + *text : ancestor->sessionIDString();
  }
  return text;
}

std::shared_ptr<TarneldSession> TarneldAgent::getAncestorWithAggregatorForSession(TarneldSession& session)
    TARNEL_NO_THREAD_SAFETY_ANALYSIS {
  const MaybeDictionary userInfo = session.userInfo();
  if (!userInfo) {
    TARNEL_LOG(dependencies_.log, information,
               "getAncestorWithAggregatorForSession: No user info found for session %u", session.sessionID());
    return nullptr;
  }
  const int32_t hierarchy = session.getSessionHierarchy();
  if (hierarchy < 1) return nullptr;
  const SessionList* list = correlatedList(userInfoKey(userInfo));
  if (list == nullptr) return nullptr;
  return topMostAggregator(hierarchy, firstOfLevelsBeside(session, *list));
}

void TarneldAgent::updateDownstreamSessions(TarneldSession& session) {
  Log& log = dependencies_.log;
  const MaybeDictionary userInfo = session.userInfo();
  if (!userInfo) {
    TARNEL_LOG(log, information, "updateDownstreamSessions: No user info found for session %u",
               session.sessionID());
    return;
  }
  const LockGuard guard(_lock);
  session.updateCombinedSessionID();
  session.syncReportingStates();
  const int32_t hierarchy = session.getSessionHierarchy();
  const bool ancestorAggregates = hierarchy >= 1 && getAncestorWithAggregatorForSession(session) != nullptr;
  if (ancestorAggregates) session.shutdownSessionAggregation();
  const SessionList* list = correlatedList(userInfoKey(userInfo));
  if (list == nullptr) return;
  for (const auto& deeper : *list) {
    if (deeper->getSessionHierarchy() <= hierarchy) continue;
    TARNEL_LOG(log, debug,
               "updateDownstreamSessions: Updating combined session ID and syncing reporting states for "
               "session %u",
               deeper->sessionID());
    deeper->updateCombinedSessionID();
    deeper->syncReportingStates();
    if ((session.hasAggregator() || ancestorAggregates) && deeper->hasAggregator()) {
      deeper->shutdownSessionAggregation();
    }
  }
}

const TarneldAgent::SessionList* TarneldAgent::correlatedList(const std::string& key) const {
  const auto found = _correlatedSessions.find(key);
  return found == _correlatedSessions.end() || found->second.empty() ? nullptr : &found->second;
}

TarneldAgent::SessionList& TarneldAgent::correlatedListForAdding(const std::string& key) {
  const auto found = _correlatedSessions.find(key);
  if (found != _correlatedSessions.end()) return found->second;
  if (correlationKeyBytes_ + key.size() > kCorrelationKeyBytes) dropEmptyLists();
  SessionList& list = _correlatedSessions[key];
  correlationKeyBytes_ += key.size();
  correlationKeys_.store(_correlatedSessions.size(), std::memory_order_relaxed);
  return list;
}

// An empty list stays where it is: this only keeps clients that invent names from filling the memory.
void TarneldAgent::dropEmptyLists() {
  std::erase_if(_correlatedSessions, [this](const auto& entry) TARNEL_NO_THREAD_SAFETY_ANALYSIS {
    if (!entry.second.empty()) return false;
    correlationKeyBytes_ -= entry.first.size();
    return true;
  });
  correlationKeys_.store(_correlatedSessions.size(), std::memory_order_relaxed);
}

void TarneldAgent::removeFromCorrelatedSessions(const TarneldSession& session) {
  const auto filed = filedUnder_.find(&session);
  if (filed == filedUnder_.end()) return;
  SessionList& list = _correlatedSessions[filed->second];
  std::erase_if(list, [&session](const std::shared_ptr<TarneldSession>& candidate) {
    return candidate.get() == &session;
  });
  filedUnder_.erase(filed);
}

std::unordered_map<std::string, std::vector<std::shared_ptr<TarneldSession>>>
TarneldAgent::correlatedSessions() {
  const LockGuard guard(_lock);
  return _correlatedSessions;
}

}  // namespace tarnel
