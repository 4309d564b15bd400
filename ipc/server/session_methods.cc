#include "ipc/server/session_methods.h"

#include <systemd/sd-bus.h>

#include <array>
#include <climits>
#include <cstring>
#include <utility>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/dbus/wire_size.h"
#include "ipc/protocol/wire.h"
#include "ipc/server/connection_loop.h"
#include "ipc/server/message_batch.h"
#include "ipc/server/send_call.h"

namespace tarnel {
namespace {

using wire::Method;

constexpr size_t kPerName = 32;
// Of the longest path, every byte of it percent-encoded.
constexpr size_t kMaxFileURL = 3 * size_t{PATH_MAX} + 7;

bool wantsReply(const SessionCall& call) {
  return sd_bus_message_get_expect_reply(call.message) > 0;
}

CallToken tokenOf(const SessionCall& call) {
  return {call.link, call.serial};
}

// How each kind of result goes into an answer, and about how many bytes it takes there beside the least.
using MaybeNames = std::optional<std::vector<std::string>>;

MaybeError append(sd_bus_message* m, bool value) {
  if (sd_bus_message_append(m, "b", value ? 1 : 0) >= 0) return std::nullopt;
  return Error(wire::kErrorFailed, -1, "no memory");
}
MaybeError append(sd_bus_message* m, const MaybeString& text) {
  return wire::appendMaybeString(m, text);
}
MaybeError append(sd_bus_message* m, const MaybeNames& names) {
  return wire::appendMaybeNames(m, names);
}
MaybeError append(sd_bus_message* m, const MaybeSentObject& sent) {
  return wire::appendMaybeSentObject(m, sent);
}
MaybeError append(sd_bus_message* m, const MaybeError& error) {
  return wire::appendMaybeError(m, error);
}

size_t bytesOf(bool) {
  return 0;
}
size_t bytesOf(const MaybeString& text) {
  return text ? text->size() : 0;
}
size_t bytesOf(const MaybeNames& names) {
  return names ? names->size() * kPerName : 0;
}
size_t bytesOf(const MaybeSentObject& sent) {
  return answerBytes(sent) - kSmallAnswer;
}
size_t bytesOf(const MaybeError&) {
  return 0;
}

// What the session calls with its results, which answers the call; null when the client wants no answer.
template <class... Results>
OneShot<void(Results...)> replyTo(const SessionCall& call) {
  if (!wantsReply(call)) return nullptr;
  return [token = tokenOf(call)](Results... results) mutable {
    const size_t bytes = (kSmallAnswer + ... + bytesOf(results));
    token.answer(bytes, [... held = std::move(results)](sd_bus_message* m) {
      MaybeError failed;
      static_cast<void>(((failed = append(m, held)).has_value() || ...));
      return failed;
    });
  };
}

MaybeError setSessionInfo(const SessionCall& call) {
  auto sessionInfo = wire::readMaybeDictionary(call.message);
  if (!sessionInfo) return sessionInfo.error();
  auto userInfo = wire::readMaybeDictionary(call.message);
  if (!userInfo) return userInfo.error();
  auto frameworks = wire::readMaybeArray(call.message);
  if (!frameworks) return frameworks.error();
  int hasAggregationBlock = 0;
  sd_bus_message_read_basic(call.message, 'b', &hasAggregationBlock);
  call.session.setSessionInfo(*std::move(sessionInfo), *std::move(userInfo), *std::move(frameworks),
                              hasAggregationBlock != 0);
  if (wantsReply(call)) {
    tokenOf(call).answer(0, [](sd_bus_message*) -> MaybeError { return std::nullopt; });
  }
  return std::nullopt;
}

MaybeError startConfig(const SessionCall& call) {
  call.session.startConfigWithCompletionHandler(replyTo<MaybeNames>(call));
  return std::nullopt;
}

MaybeError fetchStates(const SessionCall& call) {
  auto userInfo = wire::readMaybeDictionary(call.message);
  if (!userInfo) return userInfo.error();
  call.session.fetchStatesWithUserInfo(*std::move(userInfo), replyTo<MaybeNames>(call));
  return std::nullopt;
}

MaybeError fetchDisplayURL(const SessionCall& call) {
  call.session.fetchDisplayURL(replyTo<MaybeString>(call));
  return std::nullopt;
}

MaybeError sendMessage(const SessionCall& call) {
  uint16_t category = 0;
  uint16_t type = 0;
  sd_bus_message_read_basic(call.message, 'q', &category);
  sd_bus_message_read_basic(call.message, 'q', &type);
  auto payload = wire::readMaybeDictionary(call.message);
  if (!payload) return payload.error();
  call.session.sendMessageWithCategory(category, type, *std::move(payload), replyTo<MaybeSentObject>(call));
  return std::nullopt;
}

MaybeError sendMessageDictionary(const SessionCall& call) {
  auto message = wire::readDictionary(call.message);
  if (!message) return message.error();
  call.session.sendMessageWithDictionary(*std::move(message), replyTo<MaybeSentObject>(call));
  return std::nullopt;
}

MaybeError sendMessages(const SessionCall& call) {
  auto messages = readBatch(call.message);
  if (!messages) return messages.error();
  runBatch(call, *std::move(messages));
  return std::nullopt;
}

MaybeError flushMessages(const SessionCall& call) {
  call.session.flushMessagesWithCompletion(replyTo<MaybeString, MaybeError>(call));
  return std::nullopt;
}

MaybeError finishSession(const SessionCall& call) {
  call.session.finishSessionWithReply(replyTo<MaybeSentObject>(call));
  return std::nullopt;
}

MaybeError uploadLogData(const SessionCall& call) {
  auto logData = wire::readArray(call.message);
  if (!logData) return logData.error();
  call.session.uploadLogData(*std::move(logData), replyTo<bool, MaybeError>(call));
  return std::nullopt;
}

// The token that the session gets in the place of the descriptor is good for as long as this call runs.
MaybeError uploadFile(const SessionCall& call) {
  const char* fileURL = nullptr;
  if (call.descriptors.size() != 1) {
    return Error(
        wire::kErrorInvalidArguments, -1,
        "UploadFile takes the file's descriptor, one that comes with the message, whose header announces "
        "it; not " +
            std::to_string(call.descriptors.size()));
  }
  if (call.descriptorIndex != 0) {
    return Error(wire::kErrorInvalidArguments, -1,
                 "UploadFile names the descriptor by the index " + std::to_string(call.descriptorIndex) +
                     "; one came with the message, and its index is 0");
  }
  if (sd_bus_message_read(call.message, "s", &fileURL) < 0) {
    return Error(wire::kErrorInvalidArguments, -1, "the file's URL cannot be read");
  }
  if (std::strlen(fileURL) > kMaxFileURL) {
    return Error(wire::kErrorInvalidArguments, -1,
                 "the file's URL is longer than " + std::to_string(kMaxFileURL) + " bytes");
  }
  if (call.clientFiles == nullptr) return Error(wire::kErrorFailed, -1, "this service takes no files");
  const auto offer =
      call.clientFiles->offer(std::move(call.descriptors.front()), fileURL, call.link, call.uid);
  call.session.uploadFileAtPath(fileURL, offer.token(), replyTo<bool>(call));
  return std::nullopt;
}

MaybeError sendSingleMessage(const SessionCall& call) {
  auto sessionInfo = wire::readMaybeDictionary(call.message);
  if (!sessionInfo) return sessionInfo.error();
  auto userInfo = wire::readMaybeDictionary(call.message);
  if (!userInfo) return userInfo.error();
  // Unlike the payload, these stay with the session.
  const size_t kept = wire::approximateSize(*sessionInfo) + wire::approximateSize(*userInfo);
  if (kept > wire::kMaxKeptBytes) {
    return Error(wire::kErrorTooLarge, -1,
                 "what a session keeps may have " + std::to_string(wire::kMaxKeptBytes) +
                     " bytes, and session info and user info take about " + std::to_string(kept));
  }
  uint16_t category = 0;
  uint16_t type = 0;
  sd_bus_message_read_basic(call.message, 'q', &category);
  sd_bus_message_read_basic(call.message, 'q', &type);
  auto payload = wire::readMaybeDictionary(call.message);
  if (!payload) return payload.error();
  call.session.sendMessageWithSessionInfo(*std::move(sessionInfo), *std::move(userInfo), category, type,
                                          *std::move(payload), replyTo<MaybeString>(call));
  return std::nullopt;
}

struct SessionMethod {
  const Method& method;
  MaybeError (*run)(const SessionCall&);
};

// The frequent ones first: the table is searched from the front.
constexpr std::array kMethods{
    SessionMethod{wire::kSendMessage, sendMessage},
    SessionMethod{wire::kSendMessages, sendMessages},
    SessionMethod{wire::kSendMessageDictionary, sendMessageDictionary},
    SessionMethod{wire::kSetSessionInfo, setSessionInfo},
    SessionMethod{wire::kStartConfig, startConfig},
    SessionMethod{wire::kFetchStates, fetchStates},
    SessionMethod{wire::kFetchDisplayURL, fetchDisplayURL},
    SessionMethod{wire::kFlushMessages, flushMessages},
    SessionMethod{wire::kFinishSession, finishSession},
    SessionMethod{wire::kUploadLogData, uploadLogData},
    SessionMethod{wire::kUploadFile, uploadFile},
    SessionMethod{wire::kSendSingleMessage, sendSingleMessage},
};

// Splits "aa{sv}qq" into its complete types, one <arg> element for each.
void describeArguments(std::string& xml, const char* signature, const char* direction) {
  const char* start = signature;
  int nesting = 0;
  for (const char* at = signature; *at != '\0'; ++at) {
    if (*at == '(' || *at == '{') ++nesting;
    if (*at == ')' || *at == '}') --nesting;
    if (*at == 'a' || nesting > 0) continue;
    xml += "   <arg type=\"" + std::string(start, at + 1) + "\" direction=\"" + direction + "\"/>\n";
    start = at + 1;
  }
}

}  // namespace

MaybeError callSessionMethod(const SessionCall& call) {
  const char* member = sd_bus_message_get_member(call.message);
  for (const auto& [method, run] : kMethods) {
    if (std::strcmp(method.name, member) != 0) continue;
    const char* signature = sd_bus_message_get_signature(call.message, 1);
    if (signature != nullptr && std::strcmp(signature, method.arguments) == 0) return run(call);
    return Error(wire::kErrorInvalidArguments, -1,
                 std::string(method.name) + " takes the arguments \"" + method.arguments + "\", not \"" +
                     (signature == nullptr ? "" : signature) + '"');
  }
  return Error(SD_BUS_ERROR_UNKNOWN_METHOD, -1,
               "Unknown method " + std::string(member) + "; introspection lists the methods.");
}

void runSendCall(const SessionCall& call, SendCall sendCall) {
  switch (sendCall.kind) {
    case SendCall::Kind::batch:
      return runBatch(call, std::move(sendCall.messages));
    case SendCall::Kind::dictionary:
      return call.session.sendMessageWithDictionary(std::move(sendCall.dictionary),
                                                    replyTo<MaybeSentObject>(call));
    case SendCall::Kind::message:
      auto& message = sendCall.messages.front();
      return call.session.sendMessageWithCategory(message.category, message.type, std::move(message.payload),
                                                  replyTo<MaybeSentObject>(call));
  }
}

std::string describeSessionInterface() {
  std::string xml = " <interface name=\"" + std::string(wire::kSessionInterface) + "\">\n";
  for (const auto& [method, run] : kMethods) {
    xml += "  <method name=\"" + std::string(method.name) + "\">\n";
    describeArguments(xml, method.arguments, "in");
    describeArguments(xml, method.result, "out");
    xml += "  </method>\n";
  }
  return xml + " </interface>\n";
}

}  // namespace tarnel
