#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/error.h"
#include "base/one_shot.h"
#include "base/value.h"

// The two protocols between a client process and the daemon. Each side implements one and calls the other
// through a proxy; dictionaries use the keys of include/tarnel/keys.h.

namespace tarnel {

using NamesReply = OneShot<void(std::optional<std::vector<std::string>> names)>;
// What a backend's send returned, as it stands: a text, an error, or nothing.
using SentReply = OneShot<void(MaybeSentObject sent)>;
using TextReply = OneShot<void(MaybeString text)>;
using FlushReply = OneShot<void(MaybeString text, MaybeError error)>;
using SuccessReply = OneShot<void(bool success)>;
using UploadReply = OneShot<void(bool success, MaybeError error)>;

// Implemented by the daemon, one object per connection. Every call runs on the connection's own thread;
// replies may be given on any thread, later, or never (an empty reply means that none is wanted).
class ClientSessionInterface {
 public:
  ClientSessionInterface() = default;
  ClientSessionInterface(const ClientSessionInterface&) = delete;
  ClientSessionInterface& operator=(const ClientSessionInterface&) = delete;
  virtual ~ClientSessionInterface() = default;

  // setSessionInfo:userInfo:frameworksToCheck:hasAggregationBlock:
  virtual void setSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo,
                              std::optional<Array> frameworksToCheck, bool hasAggregationBlock) = 0;
  // startConfigWithCompletionHandler:
  virtual void startConfigWithCompletionHandler(NamesReply reply) = 0;
  // fetchStatesWithUserInfo:completionHandler:
  virtual void fetchStatesWithUserInfo(MaybeDictionary userInfo, NamesReply completionHandler) = 0;
  // fetchDisplayURL:
  virtual void fetchDisplayURL(TextReply reply) = 0;
  // sendMessageWithCategory:type:payload:reply:
  virtual void sendMessageWithCategory(uint16_t category, uint16_t type, MaybeDictionary payload,
                                       SentReply reply) = 0;
  // sendMessageWithDictionary:reply:
  virtual void sendMessageWithDictionary(Dictionary message, SentReply reply) = 0;
  // flushMessagesWithCompletion:
  virtual void flushMessagesWithCompletion(FlushReply completion) = 0;
  // finishSessionWithReply:
  virtual void finishSessionWithReply(SentReply reply) = 0;
  // uploadFileAtPath:extensionToken:completionHandler:
  virtual void uploadFileAtPath(std::string fileURL, std::string extensionToken,
                                SuccessReply completionHandler) = 0;
  // uploadLogData:completionHandler:
  virtual void uploadLogData(Array logData, UploadReply completionHandler) = 0;
  // sendMessageWithSessionInfo:userInfo:category:type:payload:reply:
  virtual void sendMessageWithSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo,
                                          uint16_t category, uint16_t type, MaybeDictionary payload,
                                          TextReply reply) = 0;
};

// Implemented by the client, for aggregation.
class ClientSessionReplyInterface {
 public:
  ClientSessionReplyInterface() = default;
  ClientSessionReplyInterface(const ClientSessionReplyInterface&) = delete;
  ClientSessionReplyInterface& operator=(const ClientSessionReplyInterface&) = delete;
  virtual ~ClientSessionReplyInterface() = default;

  // sendMessageToClient:timestamp:category:type:payload:
  // timestamp: seconds since 1970. No message info, time 0, category 0, type 0 and no payload together are
  // the signal that aggregation ends.
  virtual void sendMessageToClient(MaybeDictionary messageInfo, double timestamp, uint16_t category,
                                   uint16_t type, MaybeDictionary payload) = 0;
};

}  // namespace tarnel
