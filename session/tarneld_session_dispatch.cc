// One message: from the client's call to the aggregating client and to every backend.

#include <utility>

#include "session/separately.h"
#include "session/tarneld_session.h"
#include "tarnel/keys.h"
#include "util/message_log.h"

namespace tarnel {
namespace {

// The text itself where there is one: it may be large, and it goes to the client afterwards.
const char* printableObject(const SentObject& object, std::string& storage) {
  if (const auto* text = std::get_if<std::string>(&object)) return text->c_str();
  storage = description(object);
  return storage.c_str();
}

}  // namespace

void TarneldSession::sendMessageWithCategory(uint16_t category, uint16_t type, MaybeDictionary payload,
                                             SentReply reply) {
  TARNEL_LOG(dependencies_.log, debug, "sendMessageWithCategory: Sending message for session %u",
             sessionID());
  reply(sendMessageWithCategory(category, type, payload));
}

void TarneldSession::sendMessageWithDictionary(Dictionary message, SentReply reply) {
  TARNEL_LOG(dependencies_.log, debug, "sendMessageWithCategory: Sending message for session %u",
             sessionID());
  reply(sendMessageWithDictionary(message));
}

MaybeSentObject TarneldSession::sendMessageWithCategory(uint16_t category, uint16_t type,
                                                        const MaybeDictionary& payload) {
  // What sendMessageWithDictionary would read back from a dictionary of these values is known already.
  if (_backends.empty()) return sendMessageWithDictionary({});
  return dispatch(category, type, payload, Flag::normal);
}

MaybeSentObject TarneldSession::sendMessageWithDictionary(const Dictionary& message) {
  Log& log = dependencies_.log;
  if (_backends.empty()) {
    TARNEL_LOG(log, debug, "sendMessageWithDictionary: No backends available to send message");
    return std::nullopt;
  }
  const Value* category = message.find(kTarnelMessageParametersCategory);
  if (category == nullptr) {
    TARNEL_LOG(log, debug, "sendMessageWithDictionary: Missing mandatory parameter 'category'");
    return std::nullopt;
  }
  const Value* type = message.find(kTarnelMessageParametersType);
  if (type == nullptr) {
    TARNEL_LOG(log, debug, "sendMessageWithDictionary: Missing mandatory parameter 'type'");
    return std::nullopt;
  }
  const Dictionary* payload = findDictionary(message, kTarnelMessageParametersPayload);
  const Value* flag = message.find(kTarnelMessageParametersFlag);
  return dispatch(category->uint16Value(), type->uint16Value(),
                  payload != nullptr ? MaybeDictionary(*payload) : std::nullopt,
                  flag != nullptr ? Flag{flag->int32Value()} : Flag::normal);
}

MaybeSentObject TarneldSession::dispatch(uint16_t category, uint16_t type, const MaybeDictionary& payload,
                                         Flag flag) {
  const TimeValue now = dependencies_.clock.timeOfDay();
  aggregateMessage(_sessionInfo, secondsFromTimeValue(now), category, type, payload);
  MaybeSentObject result;
  for (const auto& [name, backend] : currentBackends()) {
    MaybeSentObject sent =
        answerOf(dependencies_.log, "sendMessageWithDictionary", name,
                 [&payload, &now, category, type, flag, &each = *backend] {
                   return each.sendMessage(payload, now, Method{category}, RespCode{type}, flag);
                 });
    if (!sent) continue;
    std::string storage;
    writeToLogFile(dependencies_, "[%s -> sendMessageWithDictionary] %s", name.c_str(),
                   printableObject(*sent, storage));
    if (name == kTarnelBackendHTTPPost || (name == kTarnelBackendDashboard && !result)) {
      result = std::move(sent);
    }
  }
  return result;
}

void TarneldSession::internalSendMessage(const MaybeDictionary& payload, const TimeValue& /*timestamp*/,
                                         Method method, RespCode respCode) {
  sendMessageWithCategory(static_cast<uint16_t>(method), static_cast<uint16_t>(respCode), payload);
  TARNEL_LOG(dependencies_.log, debug, "internalSendMessage: Sent internal message (method:%d respCode:%d)",
             static_cast<int>(method), static_cast<int>(respCode));
}

MaybeDictionary TarneldSession::withUserInfo(const MaybeDictionary& payload) const {
  if (!payload || !_userInfo) return payload;
  Dictionary merged = *payload;
  merged.merge(*_userInfo);
  return merged;
}

void TarneldSession::aggregateMessage(const MaybeDictionary& messageInfo, double timestamp, uint16_t category,
                                      uint16_t type, const MaybeDictionary& payload) {
  // A top-level session and one without user info have no ancestors: the delegate says so from what the
  // session holds itself, and a lock that all sessions share stays off their road.
  if (getSessionHierarchy() < 1 || !_userInfo) {
    _sessionDelegate->getAncestorWithAggregatorForSession(*this);
  } else {
    const LockGuard guard(_sessionDelegate->agentLock());
    if (const auto ancestor = _sessionDelegate->getAncestorWithAggregatorForSession(*this)) {
      ancestor->sendToAggregator(messageInfo, timestamp, category, type, withUserInfo(payload));
      return;
    }
  }
  if (hasAggregator()) sendToAggregator(messageInfo, timestamp, category, type, withUserInfo(payload));
}

void TarneldSession::sendToAggregator(const MaybeDictionary& messageInfo, double timestamp, uint16_t category,
                                      uint16_t type, const MaybeDictionary& payload) {
  const auto send = [this, &messageInfo, timestamp, category, type, &payload] {
    const auto proxy =
        _connection->remoteObjectProxyWithErrorHandler([&log = dependencies_.log](const Error& error) {
          TARNEL_LOG(log, error, "sendMessageWithDictionary: Failed to get remote object proxy: %s",
                     error.description().c_str());
        });
    if (proxy != nullptr) proxy->sendMessageToClient(messageInfo, timestamp, category, type, payload);
  };
  // Backends get a message, and a walk reaches the other sessions, also where a client cannot be told.
  separately(dependencies_.log, "sendToAggregator", "the call of the client", send);
}

void TarneldSession::shutdownSessionAggregation() {
  TARNEL_LOG(dependencies_.log, debug,
             "shutdownSessionAggregation: Disable aggregation module for session %u", sessionID());
  // Walks of several sessions may come here; the client is told once.
  if (_hasAggregator.exchange(false)) sendToAggregator(std::nullopt, 0.0, 0, 0, std::nullopt);
}

}  // namespace tarnel
