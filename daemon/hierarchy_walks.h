#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <vector>

// How the sessions of one correlation key are looked through for those above one of them.
//
// A session's level is its own thread's to change, without the agent's lock: one that configures anew stands
// at level 0 for a moment. Two looks at a session may therefore find two levels, and a walk that looked again
// could find nobody where it saw somebody, or a session above itself. So a walk looks at every level once, at
// its start, and goes by what it saw. These are templates so that a test can put in sessions that never stand
// still.

namespace tarnel {

// The sessions that count for a walk: the first of each level, by level. Levels come out of a document and
// may be any numbers, so that walks go from session to session, never from number to number.
template <class Session>
using FirstOfLevels = std::map<int32_t, std::shared_ptr<Session>>;

// Looks once at each session of the list but this one, whose own level the caller has read.
template <class Session>
FirstOfLevels<Session> firstOfLevelsBeside(const Session& session,
                                           const std::vector<std::shared_ptr<Session>>& sessionList) {
  FirstOfLevels<Session> first;
  for (const auto& other : sessionList) {
    if (other.get() != &session) first.try_emplace(other->getSessionHierarchy(), other);
  }
  return first;
}

// getFirstSessionWithHierarchy:inSessionList:
// hierarchy: wide enough for the level above the lowest. Null when nobody stands there.
template <class Session>
std::shared_ptr<Session> getFirstSessionWithHierarchy(int64_t hierarchy,
                                                      const FirstOfLevels<Session>& sessionList) {
  if (hierarchy < INT32_MIN || hierarchy > INT32_MAX) return nullptr;
  const auto found = sessionList.find(static_cast<int32_t>(hierarchy));
  return found == sessionList.end() ? nullptr : found->second;
}

// The top-most of the sessions at levels 0 to hierarchy - 1 that aggregates; null when none does.
template <class Session>
std::shared_ptr<Session> topMostAggregator(int32_t hierarchy, const FirstOfLevels<Session>& sessionList) {
  for (auto above = sessionList.lower_bound(0); above != sessionList.end() && above->first < hierarchy;
       ++above) {
    if (above->second->hasAggregator()) return above->second;
  }
  return nullptr;
}

}  // namespace tarnel
