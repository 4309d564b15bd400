#pragma once

#include <systemd/sd-bus.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>

#include "platform/base/error.h"
#include "platform/base/log.h"
#include "platform/ipc/client_session_interface.h"
#include "platform/ipc/wire.h"
#include "platform/linux/ipc/connection_link.h"
#include "platform/linux/ipc/ipc_limits.h"
#include "platform/linux/unique_fd.h"

namespace tarnel {

// What an answer without much in it is counted as, bytes.
inline constexpr size_t kSmallAnswer = 128;

struct UnrefBusMessage {
  void operator()(sd_bus_message* message) const noexcept { sd_bus_message_unref(message); }
};
using BusMessage = std::unique_ptr<sd_bus_message, UnrefBusMessage>;

// The inside of a connection's thread: reads the client's calls, runs them, writes the answers.
//
// One call is read at a time, and none while an earlier answer still waits for the client to read, so that a
// client holds no more of us than its socket and one answer. Threads: made, run and destroyed on one.
class ConnectionLoop {
 public:
  struct Setup {
    std::shared_ptr<ConnectionLink> link;
    std::shared_ptr<ClientSessionInterface> object;
    std::function<void()> interruptionHandler;
    std::string peer;  // for logs
    IpcLimits limits;
    Log& log;
  };

  ConnectionLoop(Setup setup, UniqueFd socket);
  ConnectionLoop(const ConnectionLoop&) = delete;
  ConnectionLoop& operator=(const ConnectionLoop&) = delete;
  ~ConnectionLoop();

  // Returns when the connection is over; the socket is closed by then.
  void run();

  // Answers the call unless that was done, or nobody can read it any more.
  template <class EncodeAnswer>
  void answer(uint64_t serial, EncodeAnswer encode) {
    const BusMessage call = takeCall(serial);
    if (call == nullptr || peerGone_) return;
    sd_bus_message* made = nullptr;
    if (sd_bus_message_new_method_return(call.get(), &made) < 0) return;
    const BusMessage reply(made);
    if (const MaybeError error = encode(reply.get())) {
      refuse(call.get(), wire::kErrorFailed, "the answer cannot be sent: " + error->localizedDescription());
    } else {
      sd_bus_send(bus_.get(), reply.get(), nullptr);
    }
  }
  // The call's reply was let go of without an answer.
  void abandon(uint64_t serial);
  // Sends a call of the client's object; `append` adds its arguments.
  template <class Append>
  MaybeError callClient(const char* member, Append append) {
    BusMessage message;
    if (MaybeError error = newClientCall(member, message)) return error;
    if (MaybeError error = append(message.get())) return error;
    return send(message.get());
  }

 private:
  using SteadyTime = std::chrono::steady_clock::time_point;
  struct CloseBus {
    // Nothing is flushed: a client that does not read must not hold the thread.
    void operator()(sd_bus* bus) const noexcept { sd_bus_close_unref(bus); }
  };
  struct Wakeup {
    bool input = false;
    bool hangup = false;
    bool inputEnded = false;
  };

  bool open();
  bool step();
  bool authenticate(const Wakeup& wakeup);
  bool serve(const Wakeup& wakeup);
  bool serveRest();
  bool processOnce();
  bool countPartialMessage();
  bool writeOutput();
  void runTasks();
  bool stopWanted();
  std::optional<Wakeup> wait();
  bool wantsInput();
  bool outputPending();
  bool deadlinePassed();
  void enterInterruption();
  bool unreadBytes(int& bytes) const;

  int onMessage(sd_bus_message* message);
  void onCall(sd_bus_message* message);
  void runCall(sd_bus_message* message);
  void callFailed(sd_bus_message* message, const char* what);
  BusMessage takeCall(uint64_t serial);
  MaybeError newClientCall(const char* member, BusMessage& message);
  MaybeError send(sd_bus_message* message);
  void refuse(sd_bus_message* call, const char* name, const std::string& text);

  Setup setup_;
  UniqueFd socket_;  // until the bus owns it
  int busFd_ = -1;
  std::unique_ptr<sd_bus, CloseBus> bus_;
  std::unordered_map<uint64_t, BusMessage> unanswered_;

  // The call whose method runs now.
  sd_bus_message* current_ = nullptr;
  uint64_t currentSerial_ = 0;
  bool currentAbandoned_ = false;
  uint64_t lastSerial_ = 0;

  bool ready_ = false;  // authenticated
  // Until the library was first seen with nothing to do: calls may have come in one piece with the
  // authentication, and lie in its buffer where no descriptor tells of them.
  bool mayHoldInput_ = false;
  bool inputEnded_ = false;  // the peer sends no more, and everything it sent was read
  bool peerGone_ = false;    // nobody reads answers
  std::optional<SteadyTime> deadline_;

  // Bounding the size of a message.
  uint64_t messages_ = 0;
  unsigned quietReads_ = 0;
  size_t partialBytes_ = 0;
};

template <class Encode>
void CallToken::answer(size_t bytes, Encode encode) {
  const auto link = std::move(link_);
  if (link == nullptr) return;
  if (auto* loop = link->loopOfThisThread()) {
    loop->answer(serial_, std::move(encode));
    return;
  }
  link->post(bytes, [serial = serial_, encode = std::move(encode)](ConnectionLoop& loop) mutable {
    loop.answer(serial, std::move(encode));
  });
}

}  // namespace tarnel
