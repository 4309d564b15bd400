#include "client/src/request_codec.h"

#include <systemd/sd-bus.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string>
#include <string_view>
#include <utility>
#include <variant>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/protocol/wire.h"

namespace tarnel::core {
namespace {

using Kind = Request::Kind;

constexpr wire::Method kPing{"Ping", "", ""};
constexpr char kPeerInterface[] = "org.freedesktop.DBus.Peer";

Outcome systemFailure(const char* what, int error) {
  return failure(TARNEL_ERROR_SYSTEM, std::string(what) + ": " + strerrordesc_np(error));
}

// How the requests travel. A flag travels only in a batch.
const wire::Method& methodFor(std::span<const Request> requests) {
  switch (requests.front().kind) {
    case Kind::setSessionInfo:
      return wire::kSetSessionInfo;
    case Kind::startConfig:
      return wire::kStartConfig;
    case Kind::fetchStates:
      return wire::kFetchStates;
    case Kind::fetchDisplayURL:
      return wire::kFetchDisplayURL;
    case Kind::sendMessage:
      return requests.size() == 1 && requests.front().flag == 0 ? wire::kSendMessage : wire::kSendMessages;
    case Kind::sendDictionary:
      return wire::kSendMessageDictionary;
    case Kind::flush:
      return wire::kFlushMessages;
    case Kind::finish:
      return wire::kFinishSession;
    case Kind::uploadFile:
      return wire::kUploadFile;
    case Kind::uploadLogData:
      return wire::kUploadLogData;
    case Kind::sendSingleMessage:
      return wire::kSendSingleMessage;
    case Kind::barrier:
      break;
  }
  return kPing;
}

// Runs the steps in order until one has an error.
template <class... Steps>
MaybeError firstError(Steps... steps) {
  MaybeError error;
  [[maybe_unused]] const bool failed = ((error = steps(), error.has_value()) || ...);
  return error;
}

MaybeError appended(int result) {
  if (result >= 0) return std::nullopt;
  return Error(wire::kErrorTooLarge, result, "the message cannot hold the value");
}

MaybeError appendNumbers(sd_bus_message* call, const Request& request) {
  return appended(sd_bus_message_append(call, "qq", request.category, request.type));
}

MaybeError appendBatch(sd_bus_message* call, std::span<const Request> requests) {
  if (auto error = appended(sd_bus_message_open_container(call, 'a', "(qquaa{sv})"))) return error;
  for (const Request& request : requests) {
    auto error = firstError(
        [call] { return appended(sd_bus_message_open_container(call, 'r', "qquaa{sv}")); },
        [call, &request] { return appendNumbers(call, request); },
        [call, &request] { return appended(sd_bus_message_append_basic(call, 'u', &request.flag)); },
        [call, &request] { return wire::appendMaybeDictionary(call, request.dictionary); },
        [call] { return appended(sd_bus_message_close_container(call)); });
    if (error) return error;
  }
  return appended(sd_bus_message_close_container(call));
}

MaybeError appendInfos(sd_bus_message* call, const Request& request) {
  return firstError([call, &request] { return wire::appendMaybeDictionary(call, request.sessionInfo); },
                    [call, &request] { return wire::appendMaybeDictionary(call, request.userInfo); });
}

MaybeError appendFile(sd_bus_message* call, const UploadFile& file) {
  const int result = sd_bus_message_append(call, "sh", file.fileURL().c_str(), file.descriptor());
  if (result == -EOPNOTSUPP) {
    return Error(wire::kErrorFailed, result, "the daemon takes no files: is it older than the library?");
  }
  return appended(result);
}

MaybeError appendArguments(sd_bus_message* call, const wire::Method& method,
                           std::span<const Request> requests) {
  const Request& request = requests.front();
  switch (request.kind) {
    case Kind::setSessionInfo: {
      const int hasAggregation = request.hasAggregation ? 1 : 0;
      return firstError([call, &request] { return appendInfos(call, request); },
                        [call, &request] { return wire::appendMaybeArray(call, request.array); },
                        [call, hasAggregation] {
                          return appended(sd_bus_message_append_basic(call, 'b', &hasAggregation));
                        });
    }
    case Kind::fetchStates:
      return wire::appendMaybeDictionary(call, request.userInfo);
    case Kind::sendMessage:
      if (&method == &wire::kSendMessages) return appendBatch(call, requests);
      return firstError([call, &request] { return appendNumbers(call, request); },
                        [call, &request] { return wire::appendMaybeDictionary(call, request.dictionary); });
    case Kind::sendDictionary:
      return wire::appendDictionary(call, *request.dictionary);
    case Kind::uploadFile:
      return appendFile(call, *request.file);
    case Kind::uploadLogData:
      return wire::appendArray(call, *request.array);
    case Kind::sendSingleMessage:
      return firstError([call, &request] { return appendInfos(call, request); },
                        [call, &request] { return appendNumbers(call, request); },
                        [call, &request] { return wire::appendMaybeDictionary(call, request.dictionary); });
    case Kind::startConfig:
    case Kind::fetchDisplayURL:
    case Kind::flush:
    case Kind::finish:
    case Kind::barrier:
      break;
  }
  return std::nullopt;
}

Answer unreadable(std::string why) {
  Answer answer;
  answer.outcome =
      failure(TARNEL_ERROR_PROTOCOL, "the daemon's answer could not be understood: " + std::move(why) +
                                         " (are the library and the daemon of one version?)");
  return answer;
}

void take(Answer& answer, Result<MaybeSentObject> sent) {
  if (!sent) {
    answer = unreadable(sent.error().localizedDescription());
  } else if (sent->has_value()) {
    SentObject& object = **sent;
    if (auto* text = std::get_if<std::string>(&object)) {
      answer.text = std::move(*text);
    } else {
      answer.error = std::get<Error>(object);
    }
  }
}

// Moves a part that was read into the answer; false, and the answer says so, when it could not be read.
template <class Part, class Field>
bool take(Answer& answer, Result<Part> part, Field& field) {
  if (!part) {
    answer = unreadable(part.error().localizedDescription());
    return false;
  }
  field = std::move(*part);
  return true;
}

Answer readAnswer(sd_bus_message* reply, Kind kind) {
  Answer answer;
  switch (kind) {
    case Kind::startConfig:
    case Kind::fetchStates:
      take(answer, wire::readMaybeNames(reply), answer.names);
      break;
    case Kind::fetchDisplayURL:
    case Kind::sendSingleMessage:
      take(answer, wire::readMaybeString(reply), answer.text);
      break;
    case Kind::sendMessage:
    case Kind::sendDictionary:
    case Kind::finish:
      take(answer, wire::readMaybeSentObject(reply));
      break;
    case Kind::flush:
      if (take(answer, wire::readMaybeString(reply), answer.text)) {
        take(answer, wire::readMaybeError(reply), answer.error);
      }
      break;
    case Kind::uploadFile: {
      int success = 0;
      if (sd_bus_message_read_basic(reply, 'b', &success) <= 0) return unreadable("no boolean");
      answer.success = success != 0;
      break;
    }
    case Kind::uploadLogData: {
      int success = 0;
      if (sd_bus_message_read_basic(reply, 'b', &success) <= 0) return unreadable("no boolean");
      answer.success = success != 0;
      take(answer, wire::readMaybeError(reply), answer.error);
      break;
    }
    case Kind::setSessionInfo:
    case Kind::barrier:
      break;
  }
  return answer;
}

Answer fromError(sd_bus_message* reply, const Request& request) {
  Answer answer;
  // Any answer will do: the daemon has read everything before.
  if (request.kind == Kind::barrier && sd_bus_message_is_method_error(reply, SD_BUS_ERROR_NO_REPLY) <= 0) {
    return answer;
  }
  const sd_bus_error* error = sd_bus_message_get_error(reply);
  const std::string_view name = error->name == nullptr ? "" : error->name;
  const std::string text = error->message == nullptr ? std::string(name) : error->message;
  if (name == SD_BUS_ERROR_NO_REPLY || name == SD_BUS_ERROR_TIMEOUT) {
    answer.outcome =
        failure(TARNEL_ERROR_TIMED_OUT, "the daemon did not answer in time (option reply_timeout_ms)");
  } else if (name == wire::kErrorNoReply) {
    answer.outcome = failure(TARNEL_ERROR_NO_REPLY, "the daemon will not answer this call: " + text);
  } else {
    answer.outcome = failure(TARNEL_ERROR_DAEMON, "the daemon did not accept the call: " + text);
  }
  return answer;
}

}  // namespace

void BusMessageDeleter::operator()(sd_bus_message* message) const noexcept {
  sd_bus_message_unref(message);
}

Outcome makeCall(sd_bus* bus, std::span<const Request> requests, BusMessage& call) {
  const wire::Method& method = methodFor(requests);
  const char* interface = &method == &kPing ? kPeerInterface : wire::kSessionInterface;
  sd_bus_message* made = nullptr;
  const int result =
      sd_bus_message_new_method_call(bus, &made, nullptr, wire::kSessionPath, interface, method.name);
  if (result < 0) return systemFailure("no message could be made", -result);
  call.reset(made);
  if (const auto error = appendArguments(made, method, requests)) {
    call.reset();
    if (error->domain() == wire::kErrorFailed)
      return failure(TARNEL_ERROR_DAEMON, error->localizedDescription());
    return failure(TARNEL_ERROR_INVALID_ARGUMENT, "this cannot be sent: " + error->localizedDescription());
  }
  return {};
}

std::vector<Answer> readAnswers(sd_bus_message* reply, std::span<const Request> requests) {
  std::vector<Answer> answers;
  answers.reserve(requests.size());
  const wire::Method& method = methodFor(requests);
  if (sd_bus_message_is_method_error(reply, nullptr) > 0) {
    answers.assign(requests.size(), fromError(reply, requests.front()));
  } else if (sd_bus_message_has_signature(reply, method.result) <= 0) {
    const char* got = sd_bus_message_get_signature(reply, 1);
    answers.assign(requests.size(),
                   unreadable(std::string("it has the signature \"") + (got == nullptr ? "" : got) +
                              "\" and not \"" + method.result + "\""));
  } else if (&method == &wire::kSendMessages) {
    sd_bus_message_enter_container(reply, 'a', "av");
    for (const Request& request : requests) {
      const bool isThere = sd_bus_message_at_end(reply, 0) == 0;
      answers.push_back(isThere ? readAnswer(reply, request.kind) : unreadable("too few results"));
    }
  } else {
    answers.push_back(readAnswer(reply, requests.front().kind));
  }
  return answers;
}

}  // namespace tarnel::core
