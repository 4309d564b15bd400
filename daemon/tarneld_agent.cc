#include "daemon/tarneld_agent.h"

#include <algorithm>
#include <utility>

namespace tarnel {
namespace {

constexpr char kEntitlement[] = "com.orvane.private.tarneld";

}  // namespace

// A session's place on the list of live ones. It goes with this unless it is kept, which is when the
// connection has a thread: only then will there be an invalidation, which takes the session off again.
// Whatever stands in the way of that, nothing but the list knows the session yet, so that the agent's lock is
// not wanted.
class TarneldAgent::ListEntry {
 public:
  ListEntry(TarneldAgent& agent, const std::shared_ptr<TarneldSession>& session)
      : agent_(agent), session_(session) {
    agent_.addSession(session_);
  }
  ListEntry(const ListEntry&) = delete;
  ListEntry& operator=(const ListEntry&) = delete;
  ~ListEntry() {
    if (!isKept_) agent_.removeSession(*session_);
  }

  void keep() noexcept { isKept_ = true; }

 private:
  TarneldAgent& agent_;
  const std::shared_ptr<TarneldSession> session_;
  bool isKept_ = false;
};

std::shared_ptr<TarneldAgent> TarneldAgent::init(const Dependencies& dependencies,
                                                 BackendFactory backendFactory,
                                                 StorebagFetcher storebagFetcher) {
  return std::make_shared<TarneldAgent>(Key(), dependencies, std::move(backendFactory),
                                        std::move(storebagFetcher));
}

TarneldAgent::TarneldAgent(Key /*key*/, const Dependencies& dependencies, BackendFactory backendFactory,
                           StorebagFetcher storebagFetcher)
    : dependencies_(dependencies),
      backendFactory_(std::move(backendFactory)),
      storebagFetcher_(std::move(storebagFetcher)) {}

bool TarneldAgent::shouldAcceptNewConnection(IpcListener& /*listener*/,
                                             std::shared_ptr<IpcConnection> connection) {
  Log& log = dependencies_.log;
  if (!connection->valueForEntitlement(kEntitlement)) {
    TARNEL_LOG(log, debug,
               "listener: new LNK connection %s does not have required tarnel entitlement. "
               "Closing connection...",
               connection->description().c_str());
    return false;
  }
  TARNEL_LOG(log, debug,
             "listener: Accepting new LNK connection %s as it has proper entitlement, %d(%d) connections.",
             connection->description().c_str(), static_cast<int>(sessionCount()),
             static_cast<int>(correlationKeys_.load(std::memory_order_relaxed)));
  auto session =
      TarneldSession::initWithSessionDelegate(dependencies_, shared_from_this(), connection, backendFactory_);
  connection->setExportedObject(session);
  connection->setRemoteObjectInterface();
  ListEntry entry(*this, session);
  connection->setInterruptionHandler([&log, weak = std::weak_ptr<TarneldSession>(session)] {
    if (const auto interrupted = weak.lock()) {
      TARNEL_LOG(log, debug, "listener: LNK connection to %s was interrupted",
                 interrupted->description().c_str());
    }
  });
  connection->setInvalidationHandler(
      [agent = shared_from_this(), session] { agent->connectionInvalidated(session); });
  const bool isServed = connection->resume();
  if (isServed) entry.keep();
  return isServed;
}

void TarneldAgent::connectionInvalidated(const std::shared_ptr<TarneldSession>& session) {
  TARNEL_LOG(dependencies_.log, debug, "listener: LNK connection to %s was invalidated",
             session->description().c_str());
  removeSession(*session);
  const LockGuard guard(_lock);
  removeFromCorrelatedSessions(*session);
}

void TarneldAgent::addSession(const std::shared_ptr<TarneldSession>& session) {
  const LockGuard guard(_sessionListLock);
  if (_sessionList.empty()) dependencies_.keepAlive.beginTransaction();
  _sessionList.push_back(session);
}

void TarneldAgent::removeSession(const TarneldSession& session) {
  const LockGuard guard(_sessionListLock);
  const auto found = std::find_if(
      _sessionList.begin(), _sessionList.end(),
      [&session](const std::shared_ptr<TarneldSession>& candidate) { return candidate.get() == &session; });
  if (found == _sessionList.end()) return;
  _sessionList.erase(found);
  if (_sessionList.empty()) dependencies_.keepAlive.endTransaction();
}

size_t TarneldAgent::sessionCount() {
  const LockGuard guard(_sessionListLock);
  return _sessionList.size();
}

std::vector<std::shared_ptr<TarneldSession>> TarneldAgent::sessionList() {
  const LockGuard guard(_sessionListLock);
  return _sessionList;
}

}  // namespace tarnel
