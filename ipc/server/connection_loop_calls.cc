#include <systemd/sd-bus.h>

#include <cstring>
#include <exception>
#include <utility>

#include "base/value.h"
#include "ipc/protocol/wire.h"
#include "ipc/server/connection_loop.h"
#include "ipc/server/generic_tools.h"
#include "ipc/server/session_methods.h"

// Calls and their answers.

namespace tarnel {

int ConnectionLoop::onMessage(sd_bus_message* message) {
  ++messages_;
  // What nobody takes is closed at the end.
  std::vector<UniqueFd> descriptors = std::exchange(announced_, {});
  uint8_t type = 0;
  if (sd_bus_message_get_type(message, &type) < 0 || type != SD_BUS_MESSAGE_METHOD_CALL) return 1;
  // Nothing that was bounded: it is not carried out.
  if (messages_ > framer_.completed()) {
    isOutOfStep_ = true;
    return 1;
  }
  const char* interface = sd_bus_message_get_interface(message);
  if (interface != nullptr && std::strcmp(interface, wire::kSessionInterface) == 0 &&
      std::strcmp(sd_bus_message_get_path(message), wire::kSessionPath) == 0) {
    // A call that waits for its answer must not hold descriptors meanwhile.
    if (!descriptors.empty() &&
        std::strcmp(sd_bus_message_get_member(message), wire::kUploadFile.name) != 0) {
      refuse(message, wire::kErrorInvalidArguments, "only UploadFile takes a descriptor");
      return 1;
    }
    runBusCall(message, descriptors);
    return 1;
  }
  if (isPeerGone()) return 1;
  return answerGenericTool(message) ? 1 : 0;
}

void ConnectionLoop::runBusCall(sd_bus_message* message, std::span<UniqueFd> descriptors) {
  const auto calls = [member = sd_bus_message_get_member(message)](const wire::Method& method) {
    return std::strcmp(member, method.name) == 0;
  };
  if (messageBytes_ > wire::kMaxKeptBytes && (calls(wire::kSetSessionInfo) || calls(wire::kFetchStates))) {
    refuseTooLarge(message, "what a session keeps may have " + std::to_string(wire::kMaxKeptBytes) +
                                " bytes, not " + std::to_string(messageBytes_));
    return;
  }
  if (std::exchange(foundNoRoom_, false)) {
    refuseForRoom(message);
    return;
  }
  const bool isLarge = messageBytes_ > setup_.limits.largeMessage;
  // A session's start, also that of a single message, may fetch its configuration.
  const bool waitsForServer =
      calls(wire::kUploadLogData) || calls(wire::kStartConfig) || calls(wire::kSendSingleMessage);
  const auto place = waitForTurn(waitsForServer ? LargeCalls::Kind::upload : LargeCalls::Kind::prompt);
  if (isLarge && !place) {
    refuseForRoom(message);
    return;
  }
  carryOut(message, [descriptors, index = lastNumber_.value()](SessionCall call) {
    call.descriptors = descriptors;
    call.descriptorIndex = index;
    return callSessionMethod(call);
  });
}

// Room for the message at hand, if it is large; nothing also when it found none.
std::optional<LargeCalls::Place> ConnectionLoop::waitForTurn(LargeCalls::Kind kind) {
  const auto& limits = setup_.limits;
  if (messageBytes_ <= limits.largeMessage) return std::nullopt;
  return setup_.largeCalls.enter(
      setup_.uid, kind, messageBytes_,
      kind == LargeCalls::Kind::prompt ? limits.waitForMessages : limits.waitForUploads);
}

void ConnectionLoop::refuseForRoom(sd_bus_message* message) {
  if (setup_.largeCalls.stopped()) {
    refuse(message, wire::kErrorFailed, "the daemon ends");
    return;
  }
  if (!std::exchange(toldOfNoRoom_, true)) {
    setup_.log.log(
        LogLevel::warning,
        "IpcConnection: %s of %s found no room among the large calls of its user: at most %zu bytes are "
        "under way at once",
        sd_bus_message_get_member(message), setup_.peer.c_str(), setup_.limits.largeBytesAtWork);
  }
  refuse(message, wire::kErrorFailed,
         "the large calls of this user that are under way leave no room for more; try again later");
}

void ConnectionLoop::refuseTooLarge(sd_bus_message* message, const std::string& why) {
  if (!std::exchange(toldOfTooLarge_, true)) {
    setup_.log.log(LogLevel::warning, "IpcConnection: %s of %s is refused: %s",
                   sd_bus_message_get_member(message), setup_.peer.c_str(), why.c_str());
  }
  refuse(message, wire::kErrorTooLarge, why);
}

// The library's way of answering needs a message; this one stands for what it has not read.
void ConnectionLoop::onSendCall(SendCall call) {
  sd_bus_message* made = nullptr;
  int r = sd_bus_message_new_method_call(bus_.get(), &made, nullptr, wire::kSessionPath,
                                         wire::kSessionInterface, call.member());
  const BusMessage message(made);
  if (r >= 0) r = sd_bus_message_set_expect_reply(made, call.wantsReply ? 1 : 0);
  if (r >= 0) r = sd_bus_message_seal(made, call.serial, 0);
  if (r < 0) {
    setup_.link->stop(std::string("its call cannot be answered: ") + strerror(-r));
    return;
  }
  carryOut(made, [&call](const SessionCall& sessionCall) -> MaybeError {
    runSendCall(sessionCall, std::move(call));
    return std::nullopt;
  });
}

template <class Run>
void ConnectionLoop::carryOut(sd_bus_message* message, Run run) {
  current_ = message;
  currentSerial_ = ++lastSerial_;
  currentAbandoned_ = false;
  runCall(message, run);
  // Answered later, from whichever thread.
  const bool owed = current_ != nullptr && sd_bus_message_get_expect_reply(message) > 0;
  current_ = nullptr;
  if (!owed || peerGone_) return;
  if (currentAbandoned_) {
    refuse(message, wire::kErrorNoReply, "no answer will come");
  } else {
    unanswered_.emplace(currentSerial_, BusMessage(sd_bus_message_ref(message)));
  }
}

template <class Run>
void ConnectionLoop::runCall(sd_bus_message* message, Run run) {
  const SessionCall call{message,     *setup_.object, setup_.link,        currentSerial_,
                         setup_.peer, setup_.log,     setup_.clientFiles, setup_.uid};
  try {
    if (const MaybeError error = run(call)) {
      current_ = nullptr;
      if (error->domain() == wire::kErrorTooLarge) {
        return refuseTooLarge(message, error->localizedDescription());
      }
      refuse(message, error->domain().c_str(), error->localizedDescription());
    }
  } catch (const std::exception& error) {
    callFailed(message, error.what());
  } catch (...) {
    callFailed(message, "unknown failure");
  }
}

void ConnectionLoop::callFailed(sd_bus_message* message, const char* what) {
  setup_.log.log(LogLevel::error, "IpcConnection: %s of %s failed: %s", sd_bus_message_get_member(message),
                 setup_.peer.c_str(), what);
  if (current_ == nullptr) return;  // it had answered before it failed
  current_ = nullptr;
  refuse(message, wire::kErrorFailed, what);
}

BusMessage ConnectionLoop::takeCall(uint64_t serial) {
  if (current_ != nullptr && serial == currentSerial_) {
    return BusMessage(sd_bus_message_ref(std::exchange(current_, nullptr)));
  }
  auto node = unanswered_.extract(serial);
  return node ? std::move(node.mapped()) : nullptr;
}

void ConnectionLoop::abandon(uint64_t serial) {
  if (current_ != nullptr && serial == currentSerial_) {
    currentAbandoned_ = true;
    return;
  }
  const BusMessage call = takeCall(serial);
  if (call != nullptr) refuse(call.get(), wire::kErrorNoReply, "no answer will come");
}

void ConnectionLoop::refuse(sd_bus_message* call, const char* name, const std::string& text) {
  if (sd_bus_message_get_expect_reply(call) <= 0 || isPeerGone()) return;
  const bool sendable = isValidUtf8(text);
  sd_bus_reply_method_errorf(call, name, "%s", sendable ? text.c_str() : "(the reason is not UTF-8)");
}

MaybeError ConnectionLoop::newClientCall(const char* member, BusMessage& message) {
  sd_bus_message* made = nullptr;
  int r = sd_bus_message_new_method_call(bus_.get(), &made, nullptr, wire::kReplyPath, wire::kReplyInterface,
                                         member);
  message.reset(made);
  if (r >= 0) r = sd_bus_message_set_expect_reply(made, 0);
  if (r >= 0) return std::nullopt;
  return Error(wire::kErrorFailed, -1, std::string("cannot call the client: ") + strerror(-r));
}

MaybeError ConnectionLoop::send(sd_bus_message* message) {
  const int r = isPeerGone() ? -ECONNRESET : sd_bus_send(bus_.get(), message, nullptr);
  if (r >= 0) return std::nullopt;
  return Error(wire::kErrorFailed, -1, std::string("cannot call the client: ") + strerror(-r));
}

}  // namespace tarnel
