#pragma once

#include <systemd/sd-bus.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "base/error.h"
#include "base/log.h"
#include "base/unique_fd.h"
#include "ipc/dbus/descriptor_passing.h"
#include "ipc/dbus/input_framer.h"
#include "ipc/protocol/client_session_interface.h"
#include "ipc/protocol/wire.h"
#include "ipc/server/client_file_registry.h"
#include "ipc/server/connection_link.h"
#include "ipc/server/ipc_limits.h"
#include "ipc/server/large_calls.h"
#include "ipc/server/send_call.h"

namespace tarnel {

// What an answer without much in it is counted as, bytes.
inline constexpr size_t kSmallAnswer = 128;

struct UnrefBusMessage {
  void operator()(sd_bus_message* message) const noexcept { sd_bus_message_unref(message); }
};
using BusMessage = std::unique_ptr<sd_bus_message, UnrefBusMessage>;

// The inside of a connection's thread: reads the client's calls, runs them, writes the answers.
//
// The socket is read here and its bytes are fed to the bus object through another: the library by itself
// reads messages of up to 128 MiB, in one go for as long as the peer keeps sending. The calls that send
// messages pass it by, unless something about them is unusual; see send_call.h. One call is carried out
// at a time, and none while an earlier answer still waits for the client to read, so that a client holds no
// more of us than a message and an answer. Descriptors that come along go to the message that announces them,
// at most wire::kMaxDescriptors; only UploadFile takes any, and all others are closed at once. They pass the
// bus by: of a message that it finds malformed the library would leave them open.
//
// Threads: made, run and destroyed on one.
class ConnectionLoop {
 public:
  struct Setup {
    std::shared_ptr<ConnectionLink> link;
    std::shared_ptr<ClientSessionInterface> object;
    std::function<void()> interruptionHandler;
    std::string peer;  // for logs
    IpcLimits limits;
    Log& log;
    ClientFileRegistry* clientFiles;  // null: this service takes no files
    LargeCalls& largeCalls;
    uint32_t uid;
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
    if (call == nullptr || isPeerGone()) return;
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
  enum class Pump { progress, idle, over };

  bool open();
  bool step();
  bool wait();
  bool serve();
  Pump pump();
  Pump processOnce();
  Pump feed();
  Pump receive();
  Pump examine();
  Pump admit(size_t bytes);
  std::optional<Pump> claimDescriptors(size_t sizeOfMessage);
  void dropDescriptors();
  std::string_view unadmitted() const;
  void makeRoom(size_t capacity);
  bool inputAtHand() const;
  bool wantsInput();
  bool outputPending();
  void runTasks();
  bool stopWanted();
  bool deadlinePassed();
  bool enterInterruption();
  bool isPeerGone();
  void peerIsGone();
  Pump closing(const std::string& why);

  int onMessage(sd_bus_message* message);
  void onSendCall(SendCall call);
  std::optional<LargeCalls::Place> waitForTurn(LargeCalls::Kind kind);
  void runBusCall(sd_bus_message* message, std::span<UniqueFd> descriptors);
  template <class Run>
  void carryOut(sd_bus_message* message, Run run);
  template <class Run>
  void runCall(sd_bus_message* message, Run run);
  void callFailed(sd_bus_message* message, const char* what);
  BusMessage takeCall(uint64_t serial);
  MaybeError newClientCall(const char* member, BusMessage& message);
  MaybeError send(sd_bus_message* message);
  void refuseForRoom(sd_bus_message* message);
  void refuseTooLarge(sd_bus_message* message, const std::string& why);
  void refuse(sd_bus_message* call, const char* name, const std::string& text);

  Setup setup_;
  UniqueFd socket_;  // until the bus owns it
  int busFd_ = -1;
  UniqueFd feed_;  // what the bus reads is written here
  std::unique_ptr<sd_bus, CloseBus> bus_;
  std::unordered_map<uint64_t, BusMessage> unanswered_;

  // Input between the socket and the bus: bytes [inputBegin_, inputEnd_) of the buffer, of which the first
  // admitted_ may be fed. There is no buffer while the connection is idle.
  InputFramer framer_{wire::kMaxMessageBytes};
  std::unique_ptr<char[]> buffer_;
  size_t capacity_ = 0;
  size_t wanted_ = 0;  // capacity that the message at hand needs
  size_t inputBegin_ = 0;
  size_t inputEnd_ = 0;
  size_t admitted_ = 0;
  size_t messageBytes_ = 0;          // of the message that was looked at last
  bool isNew_ = false;               // what is in the buffer and not admitted has not been looked at
  bool mayHaveMore_ = false;         // the socket, since the last read filled the buffer
  bool isFed_ = false;               // the bus may have something to read
  bool mayPassDescriptors_ = false;  // negotiated
  bool foundNoRoom_ = false;         // the message that the bus reads now, among the large ones
  bool toldOfDescriptors_ = false;   // that nobody asked for
  bool toldOfNoRoom_ = false;
  bool toldOfTooLarge_ = false;
  std::vector<UniqueFd> descriptors_;  // came with bytes that have not been looked at
  std::vector<UniqueFd> announced_;    // belong to the message that the bus reads now
  LastNumber lastNumber_;              // of that message
  bool isOutOfStep_ = false;           // the bus took for a message what did not come as one
  uint64_t messages_ = 0;              // that were read, by the bus or past it

  // The call whose method runs now.
  sd_bus_message* current_ = nullptr;
  uint64_t currentSerial_ = 0;
  bool currentAbandoned_ = false;
  uint64_t lastSerial_ = 0;

  bool ready_ = false;        // authenticated
  bool inputEnded_ = false;   // the peer sends no more
  bool interrupted_ = false;  // and everything it sent was carried out
  bool peerGone_ = false;     // nobody reads answers
  std::optional<SteadyTime> deadline_;
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
