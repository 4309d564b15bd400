// The session's backends: made from the storebag, told about the user, their states decided and synced.

#include <algorithm>
#include <utility>

#include "session/tarneld_session.h"
#include "tarnel/keys.h"

namespace tarnel {
namespace {

const std::string* nameIn(const MaybeDictionary& userInfo, const char* key) {
  return userInfo ? findString(*userInfo, key) : nullptr;
}

// Two missing texts are equal: nothing has changed.
bool sameText(const std::string* a, const std::string* b) {
  return a == nullptr || b == nullptr ? a == b : *a == *b;
}

bool sameNames(const MaybeDictionary& a, const MaybeDictionary& b) {
  return sameText(nameIn(a, kTarnelUserInfoClientName), nameIn(b, kTarnelUserInfoClientName)) &&
         sameText(nameIn(a, kTarnelUserInfoServiceName), nameIn(b, kTarnelUserInfoServiceName));
}

}  // namespace

const BackendSet& TarneldSession::currentBackends() {
  reporting_.applyNotes(dependencies_.log, _backends);
  return _backends;
}

void TarneldSession::createBackendsWithStorebag(const MaybeDictionary& storebag) {
  TARNEL_LOG(dependencies_.log, debug, "createBackendsWithStorebag: Creating backends for session %u",
             sessionID());
  auto created =
      createBackends(dependencies_, backendFactory_, storebag, _sessionInfo, _userInfo, deviceid());
  BackendSet backends = created ? std::move(*created) : BackendSet();
  for (const auto& [name, backend] : backends) backend->setCombinedSessionIDString(_sessionIDString);
  // A client that configures its session a second time loses nothing of the first.
  if (!_backends.empty()) internalFlushMessagesWithCompletion(nullptr);
  cleanUpEach(dependencies_.log, _backends);
  reporting_.replaceBackends(backends);
  _backends = std::move(backends);
}

void TarneldSession::updateUserInfoForBackends() {
  withEach(dependencies_.log, "updateUserInfoForBackends", currentBackends(),
           [this](const std::string& /*name*/, TarnelBackend& each) { each.setUserInfoDict(_userInfo); });
}

void TarneldSession::updateReportingStates() {
  withEach(dependencies_.log, "updateReportingStates", currentBackends(),
           [](const std::string& /*name*/, TarnelBackend& each) { each.updateState(); });
  reporting_.publish(_backends);
}

void TarneldSession::syncReportingStates() {
  const LockGuard guard(_sessionDelegate->agentLock());
  const auto parent = _sessionDelegate->parentSessionForChild(*this);
  const auto parentReports = parent != nullptr ? parent->reports() : std::vector<SharedReporting::Report>();
  for (const auto& own : reports()) {
    if (parent == nullptr) {
      if (own.hierarchy >= 1) {
        TARNEL_LOG(
            dependencies_.log, information,
            "syncReportingStates: child session %u (backend %s) with hierarchy %d is missing its parent",
            sessionID(), own.name.c_str(), own.hierarchy);
      }
      continue;
    }
    const auto of =
        std::find_if(parentReports.begin(), parentReports.end(),
                     [&own](const SharedReporting::Report& candidate) { return candidate.name == own.name; });
    if (of == parentReports.end()) {
      own.backend->setStateUnless(ReportingState::sampledOut, ReportingState::disabled);
      continue;
    }
    const ReportingState state = of->backend->state();
    if (!own.backend->setStateUnless(ReportingState::sampledOut, state)) continue;
    reporting_.noteSamplingThreshold(own.name, of->samplingThreshold);
    TARNEL_LOG(dependencies_.log, debug,
               "HTTPSPostBackend(syncReportingStates): %s: state and sampling rate updated to %d, %.02f%%",
               own.name.c_str(), static_cast<int>(state),
               of->samplingThreshold ? of->samplingThreshold->doubleValue() : 0.0);
  }
}

std::optional<std::vector<std::string>> TarneldSession::fetchReportingStates() const {
  if (_backends.empty()) return std::nullopt;
  std::vector<std::string> names;
  for (const auto& [name, backend] : _backends) {
    const ReportingState state = backend->state();
    if (state == ReportingState::enabled || state == ReportingState::sampledOut) names.push_back(name);
  }
  return names;
}

void TarneldSession::updateSessionWithDefaultSessionInfo() {
  _sessionDelegate->userInfoUpdatedForSession(*this);
  updateReportingStates();
  _sessionDelegate->updateDownstreamSessions(*this);
  reporting_.applyNotes(dependencies_.log, _backends);
}

void TarneldSession::receivedUserInfo(const MaybeDictionary& userInfo) {
  bool isNew = false;
  if (!_userInfo) {
    if (!userInfo) return;
    isNew = true;
  } else {
    const Value* required = _sessionInfo ? _sessionInfo->find(kTarnelSessionInfoRequireUserInfo) : nullptr;
    if (!userInfo && required != nullptr && required->boolValue()) return;
    isNew = !sameNames(_userInfo, userInfo);
  }
  setUserInfo(userInfo);
  updateUserInfoForBackends();
  if (!isNew) return;
  TARNEL_LOG(dependencies_.log, debug, "receivedUserInfo: Received new user info for session %u",
             sessionID());
  updateSessionWithDefaultSessionInfo();
}

void TarneldSession::updateCombinedSessionID() {
  const MaybeString parent = _sessionDelegate->parentSessionIDStringForSession(*this);
  if (!parent) return;
  std::string combined = *parent + "." + sessionIDString();
  TARNEL_LOG(dependencies_.log, debug,
             "updateCombinedSessionID: Updating combined session ID '%s' for session %u backends",
             combined.c_str(), sessionID());
  reporting_.noteCorrelatedSessionID(std::move(combined));
}

}  // namespace tarnel
