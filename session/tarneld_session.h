#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "ipc/ipc.h"
#include "ipc/protocol/client_session_interface.h"
#include "session/backend_set.h"
#include "session/shared_reporting.h"
#include "session/tarneld_session_delegate.h"
#include "util/dependencies.h"

namespace tarnel {

// Guards the counters and completions of all flush joins: one lock for the class, not one per session.
class TarneldSessionClassLock : public RecursiveLock {};

// The daemon's side of one client connection: what the client said about itself and its user, the backends
// made from its client type's storebag, and the answer to every call of ClientSessionInterface. Life: made
// when the connection is accepted; setSessionInfo; startConfig makes the backends and sends the start
// message; any number of messages, flushes, uploads and changes of user info; destroyed when the connection
// is gone, with a stop message and a flush. Calls in any other order find no backends and say so.
//
// Trust: every argument of the interface comes from a client and may have any shape within the bounds of the
// transport.
//
// Threads. The calls of ClientSessionInterface, and every operation not named next, are for the thread of the
// session's own connection; the last reference may go on any thread once that one is done.
// Walks through the hierarchy, which hold the agent's lock, use on any thread: sessionID, sessionIDString,
// userInfo, hasAggregator, setHasAggregator, getSessionHierarchy, reports, syncReportingStates,
// updateCombinedSessionID, sendToAggregator, shutdownSessionAggregation, description. What these change in
// the backends passes through SharedReporting (see there); no lock is held while a backend works.
// Order of locks: the session list's alone; the agent's before SharedReporting's; the class lock is taken
// with no other held, or under the agent's.
class TarneldSession final : public ClientSessionInterface,
                             public std::enable_shared_from_this<TarneldSession> {
  // Only initWithSessionDelegate makes sessions.
  struct Key {
    explicit Key() = default;
  };

 public:
  // initWithSessionDelegate:connection:
  // dependencies: by reference; must outlive the session. sessionDelegate and connection are retained.
  static std::shared_ptr<TarneldSession> initWithSessionDelegate(
      const Dependencies& dependencies, std::shared_ptr<TarneldSessionDelegate> sessionDelegate,
      std::shared_ptr<IpcConnection> connection,
      BackendFactory backendFactory = &TarnelBackend::newBackendWithName);
  TarneldSession(Key key, const Dependencies& dependencies,
                 std::shared_ptr<TarneldSessionDelegate> sessionDelegate,
                 std::shared_ptr<IpcConnection> connection, BackendFactory backendFactory);
  ~TarneldSession() override;

  // ClientSessionInterface.
  void setSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo,
                      std::optional<Array> frameworksToCheck, bool hasAggregationBlock) override;
  // Throws InvalidArgument for a client type without a storebag name.
  void startConfigWithCompletionHandler(NamesReply reply) override;
  void fetchStatesWithUserInfo(MaybeDictionary userInfo, NamesReply completionHandler) override;
  void fetchDisplayURL(TextReply reply) override;
  void sendMessageWithCategory(uint16_t category, uint16_t type, MaybeDictionary payload,
                               SentReply reply) override;
  void sendMessageWithDictionary(Dictionary message, SentReply reply) override;
  void flushMessagesWithCompletion(FlushReply completion) override;
  void finishSessionWithReply(SentReply reply) override;
  void uploadFileAtPath(std::string fileURL, std::string extensionToken,
                        SuccessReply completionHandler) override;
  void uploadLogData(Array logData, UploadReply completionHandler) override;
  // The reply is dropped uncalled when the session info lacks client type or session id.
  // Throws InvalidArgument for a client type without a storebag name.
  void sendMessageWithSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo, uint16_t category,
                                  uint16_t type, MaybeDictionary payload, TextReply reply) override;

  // sendMessageWithSessionInfo:userInfo:storebag:category:type:payload:, of the class
  // One message through a backend set of its own, which is gone when this returns: no aggregation, no flush,
  // no start or stop message.
  static void sendMessageWithSessionInfo(const Dependencies& dependencies, const BackendFactory& factory,
                                         const MaybeDictionary& sessionInfo, const MaybeDictionary& userInfo,
                                         const MaybeDictionary& storebag, uint16_t category, uint16_t type,
                                         const MaybeDictionary& payload);

  // sendMessageWithCategory:type:payload:error: and sendMessageWithDictionary:error:
  // The error argument is never written, so there is none. What they return is handed to the client as it
  // stands: an error, or the text of what was sent.
  MaybeSentObject sendMessageWithCategory(uint16_t category, uint16_t type, const MaybeDictionary& payload);
  MaybeSentObject sendMessageWithDictionary(const Dictionary& message);
  // internalSendMessage:timestamp:method:respCode:
  // timestamp: not used; the message is stamped when it is dispatched.
  void internalSendMessage(const MaybeDictionary& payload, const TimeValue& timestamp, Method method,
                           RespCode respCode);
  // internalFlushMessagesWithCompletion:
  void internalFlushMessagesWithCompletion(FlushCompletion completion);

  // aggregateMessage:timestamp:category:type:payload:
  // Hands the message to the client of the top-most ancestor that aggregates, else to the session's own
  // client if that one does.
  void aggregateMessage(const MaybeDictionary& messageInfo, double timestamp, uint16_t category,
                        uint16_t type, const MaybeDictionary& payload);
  // sendToAggregator:timestamp:category:type:payload:
  void sendToAggregator(const MaybeDictionary& messageInfo, double timestamp, uint16_t category,
                        uint16_t type, const MaybeDictionary& payload);
  // Tells the client that aggregation ends.
  void shutdownSessionAggregation();

  void createBackendsWithStorebag(const MaybeDictionary& storebag);
  void updateUserInfoForBackends();
  void updateReportingStates();
  // Takes the agent's lock.
  void syncReportingStates();
  // Names of the backends that report; nothing when the session has no backends.
  std::optional<std::vector<std::string>> fetchReportingStates() const;
  // Files the session under its user info, decides its states anew and syncs the deeper sessions.
  void updateSessionWithDefaultSessionInfo();
  // receivedUserInfo:
  void receivedUserInfo(const MaybeDictionary& userInfo);
  // 0 for a top-level session, n for one n levels below.
  int32_t getSessionHierarchy() const noexcept { return reporting_.hierarchy(); }
  void updateCombinedSessionID();
  void sendStartMessage();
  // Everything that happens when the last reference goes; the destructor calls it. The session is of no
  // further use afterwards; a second call does nothing.
  void dealloc() noexcept;

  uint32_t sessionID() const noexcept { return _sessionID.load(std::memory_order_relaxed); }
  void setSessionID(uint32_t sessionID) noexcept { _sessionID.store(sessionID, std::memory_order_relaxed); }
  // 24 characters of base-64.
  const std::string& sessionIDString() const noexcept { return _sessionIDString; }
  // Only before the session is shared with the agent.
  void setSessionIDString(std::string text) { _sessionIDString = std::move(text); }
  const MaybeString& storebagVersion() const noexcept { return _storebagVersion; }
  void setStorebagVersion(const MaybeString& version) { _storebagVersion = version; }
  const MaybeDictionary& sessionInfo() const noexcept { return _sessionInfo; }
  MaybeDictionary userInfo() const { return reporting_.userInfo(); }
  bool hasAggregator() const noexcept { return _hasAggregator.load(std::memory_order_relaxed); }
  void setHasAggregator(bool value) noexcept { _hasAggregator.store(value, std::memory_order_relaxed); }
  std::vector<SharedReporting::Report> reports() const { return reporting_.reports(); }
  const BackendSet& backends() const noexcept { return _backends; }
  std::string_view deviceid() const noexcept { return _deviceid.data(); }
  // For logs.
  std::string description() const;

  static TarneldSessionClassLock& classLock();

 private:
  void setUserInfo(MaybeDictionary userInfo);
  void uploadFileWithURL(const std::string& fileURL, const std::string& extensionToken,
                         SuccessReply completionHandler);
  MaybeSentObject dispatch(uint16_t category, uint16_t type, const MaybeDictionary& payload, Flag flag);
  MaybeDictionary withUserInfo(const MaybeDictionary& payload) const;
  // The backends as they are to be used now: with everything applied that other sessions noted.
  const BackendSet& currentBackends();
  void sendStopMessage();

  const Dependencies& dependencies_;
  BackendFactory backendFactory_;
  SharedReporting reporting_;
  bool ended_ = false;

  std::atomic<uint32_t> _sessionID{0};
  MaybeDictionary _sessionInfo;
  MaybeDictionary _userInfo;  // the owner's copy of what reporting_ shows
  std::optional<Array> _frameworks;
  BackendSet _backends;
  std::shared_ptr<void> _periodicServices;  // of the session's time; no service is periodic now
  std::shared_ptr<TarneldSessionDelegate> _sessionDelegate;
  std::string _sessionIDString;
  MaybeString _storebagVersion;
  std::array<char, 41> _deviceid{};
  std::shared_ptr<IpcConnection> _connection;
  std::atomic<bool> _hasAggregator{false};
};

}  // namespace tarnel
