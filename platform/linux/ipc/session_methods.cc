#include "platform/linux/ipc/session_methods.h"

#include <fcntl.h>
#include <systemd/sd-bus.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/ipc/dbus_codec.h"
#include "platform/ipc/wire.h"
#include "platform/linux/ipc/connection_loop.h"
#include "platform/linux/ipc/message_batch.h"
#include "platform/linux/ipc/send_call.h"

namespace tarnel {
namespace {

using wire::Method;

constexpr size_t kPerName = 32;

bool wantsReply(const SessionCall& call) {
  return sd_bus_message_get_expect_reply(call.message) > 0;
}

CallToken tokenOf(const SessionCall& call) {
  return {call.link, call.serial};
}

NamesReply namesReply(const SessionCall& call) {
  if (!wantsReply(call)) return nullptr;
  return [token = tokenOf(call)](std::optional<std::vector<std::string>> names) mutable {
    const size_t bytes = kSmallAnswer + (names ? names->size() * kPerName : 0);
    token.answer(bytes,
                 [names = std::move(names)](sd_bus_message* m) { return wire::appendMaybeNames(m, names); });
  };
}

SentReply sentReply(const SessionCall& call) {
  if (!wantsReply(call)) return nullptr;
  return [token = tokenOf(call)](MaybeSentObject sent) mutable {
    token.answer(answerBytes(sent), [sent = std::move(sent)](sd_bus_message* m) {
      return wire::appendMaybeSentObject(m, sent);
    });
  };
}

TextReply textReply(const SessionCall& call) {
  if (!wantsReply(call)) return nullptr;
  return [token = tokenOf(call)](MaybeString text) mutable {
    token.answer(kSmallAnswer + (text ? text->size() : 0),
                 [text = std::move(text)](sd_bus_message* m) { return wire::appendMaybeString(m, text); });
  };
}

FlushReply flushReply(const SessionCall& call) {
  if (!wantsReply(call)) return nullptr;
  return [token = tokenOf(call)](MaybeString text, MaybeError error) mutable {
    token.answer(kSmallAnswer + (text ? text->size() : 0),
                 [text = std::move(text), error = std::move(error)](sd_bus_message* m) {
                   MaybeError failed = wire::appendMaybeString(m, text);
                   return failed ? failed : wire::appendMaybeError(m, error);
                 });
  };
}

UploadReply uploadReply(const SessionCall& call) {
  if (!wantsReply(call)) return nullptr;
  return [token = tokenOf(call)](bool success, MaybeError error) mutable {
    token.answer(kSmallAnswer, [success, error = std::move(error)](sd_bus_message* m) -> MaybeError {
      if (sd_bus_message_append(m, "b", success ? 1 : 0) < 0) {
        return Error(wire::kErrorFailed, -1, "no memory");
      }
      return wire::appendMaybeError(m, error);
    });
  };
}

SuccessReply successReply(const SessionCall& call) {
  if (!wantsReply(call)) return nullptr;
  return [token = tokenOf(call)](bool success) mutable {
    token.answer(kSmallAnswer, [success](sd_bus_message* m) -> MaybeError {
      if (sd_bus_message_append(m, "b", success ? 1 : 0) >= 0) return std::nullopt;
      return Error(wire::kErrorFailed, -1, "no memory");
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
  call.session.startConfigWithCompletionHandler(namesReply(call));
  return std::nullopt;
}

MaybeError fetchStates(const SessionCall& call) {
  auto userInfo = wire::readMaybeDictionary(call.message);
  if (!userInfo) return userInfo.error();
  call.session.fetchStatesWithUserInfo(*std::move(userInfo), namesReply(call));
  return std::nullopt;
}

MaybeError fetchDisplayURL(const SessionCall& call) {
  call.session.fetchDisplayURL(textReply(call));
  return std::nullopt;
}

MaybeError sendMessage(const SessionCall& call) {
  uint16_t category = 0;
  uint16_t type = 0;
  sd_bus_message_read_basic(call.message, 'q', &category);
  sd_bus_message_read_basic(call.message, 'q', &type);
  auto payload = wire::readMaybeDictionary(call.message);
  if (!payload) return payload.error();
  call.session.sendMessageWithCategory(category, type, *std::move(payload), sentReply(call));
  return std::nullopt;
}

MaybeError sendMessageDictionary(const SessionCall& call) {
  auto message = wire::readDictionary(call.message);
  if (!message) return message.error();
  call.session.sendMessageWithDictionary(*std::move(message), sentReply(call));
  return std::nullopt;
}

MaybeError sendMessages(const SessionCall& call) {
  auto messages = readBatch(call.message);
  if (!messages) return messages.error();
  runBatch(call, *std::move(messages));
  return std::nullopt;
}

MaybeError flushMessages(const SessionCall& call) {
  call.session.flushMessagesWithCompletion(flushReply(call));
  return std::nullopt;
}

MaybeError finishSession(const SessionCall& call) {
  call.session.finishSessionWithReply(sentReply(call));
  return std::nullopt;
}

MaybeError uploadLogData(const SessionCall& call) {
  auto logData = wire::readArray(call.message);
  if (!logData) return logData.error();
  call.session.uploadLogData(*std::move(logData), uploadReply(call));
  return std::nullopt;
}

// The token that the session gets in the place of the descriptor is good for as long as this call runs.
MaybeError uploadFile(const SessionCall& call) {
  const char* fileURL = nullptr;
  int descriptor = -1;
  if (sd_bus_message_read(call.message, "sh", &fileURL, &descriptor) < 0) {
    return Error(
        wire::kErrorInvalidArguments, -1,
        "the file's descriptor is missing: it must come with the message, whose header announces it");
  }
  if (call.clientFiles == nullptr) return Error(wire::kErrorFailed, -1, "this service takes no files");
  UniqueFd file(fcntl(descriptor, F_DUPFD_CLOEXEC, 3));
  if (!file) {
    return Error(wire::kErrorFailed, -1, std::string("the file cannot be taken: ") + std::strerror(errno));
  }
  const auto offer = call.clientFiles->offer(std::move(file), fileURL, call.link);
  call.session.uploadFileAtPath(fileURL, offer.token(), successReply(call));
  return std::nullopt;
}

MaybeError sendSingleMessage(const SessionCall& call) {
  auto sessionInfo = wire::readMaybeDictionary(call.message);
  if (!sessionInfo) return sessionInfo.error();
  auto userInfo = wire::readMaybeDictionary(call.message);
  if (!userInfo) return userInfo.error();
  uint16_t category = 0;
  uint16_t type = 0;
  sd_bus_message_read_basic(call.message, 'q', &category);
  sd_bus_message_read_basic(call.message, 'q', &type);
  auto payload = wire::readMaybeDictionary(call.message);
  if (!payload) return payload.error();
  call.session.sendMessageWithSessionInfo(*std::move(sessionInfo), *std::move(userInfo), category, type,
                                          *std::move(payload), textReply(call));
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
      return call.session.sendMessageWithDictionary(std::move(sendCall.dictionary), sentReply(call));
    case SendCall::Kind::message:
      auto& message = sendCall.messages.front();
      return call.session.sendMessageWithCategory(message.category, message.type, std::move(message.payload),
                                                  sentReply(call));
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
