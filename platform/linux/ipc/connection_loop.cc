#include "platform/linux/ipc/connection_loop.h"

#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/ipc/wire.h"
#include "platform/linux/ipc/generic_tools.h"
#include "platform/linux/ipc/session_methods.h"

namespace tarnel {
namespace {

// Messages that are read before the descriptors are looked at again.
constexpr int kMessagesPerWakeup = 16;
// Reads without a complete message before the bytes are counted; nearly every message takes fewer.
constexpr unsigned kFreeReads = 3;

sd_id128_t randomId() {
  sd_id128_t id{};
  sd_id128_randomize(&id);
  return id;
}

}  // namespace

ConnectionLoop::ConnectionLoop(Setup setup, UniqueFd socket)
    : setup_(std::move(setup)), socket_(std::move(socket)) {
  setup_.link->bind(*this);
}

ConnectionLoop::~ConnectionLoop() = default;

void ConnectionLoop::run() {
  if (open()) {
    while (step()) {
    }
  }
  setup_.link->close();
  unanswered_.clear();
  bus_.reset();
  socket_.reset();
}

// The bus object speaks the server's side of the authentication and accepts everyone: who is let in was
// decided before, from what the kernel says.
bool ConnectionLoop::open() {
  sd_bus* made = nullptr;
  int r = sd_bus_new(&made);
  bus_.reset(made);
  if (r >= 0) r = sd_bus_set_fd(made, socket_.get(), socket_.get());
  if (r >= 0) busFd_ = socket_.release();
  if (r >= 0) r = sd_bus_set_server(made, 1, randomId());
  if (r >= 0) r = sd_bus_set_anonymous(made, 1);
  // No method takes descriptors. Not negotiated, the library closes what comes and ends the connection;
  // negotiated, a peer could park a thousand of them in the first half of a message.
  if (r >= 0) r = sd_bus_negotiate_fds(made, 0);
  const auto filter = [](sd_bus_message* message, void* self, sd_bus_error*) {
    return static_cast<ConnectionLoop*>(self)->onMessage(message);
  };
  if (r >= 0) r = sd_bus_add_filter(made, nullptr, filter, this);
  if (r >= 0) r = sd_bus_start(made);
  if (r < 0) {
    setup_.log.log(LogLevel::error, "IpcConnection: Cannot serve %s: %s", setup_.peer.c_str(), strerror(-r));
    return false;
  }
  deadline_ = std::chrono::steady_clock::now() + setup_.limits.authentication;
  return true;
}

bool ConnectionLoop::step() {
  runTasks();
  if (stopWanted() || deadlinePassed()) return false;
  const auto wakeup = wait();
  if (!wakeup) return false;
  return ready_ ? serve(*wakeup) : authenticate(*wakeup);
}

bool ConnectionLoop::stopWanted() {
  const auto reason = setup_.link->stopReason();
  if (!reason) return false;
  setup_.log.log(LogLevel::warning, "IpcConnection: Closing the connection of %s: %s", setup_.peer.c_str(),
                 reason->c_str());
  return true;
}

bool ConnectionLoop::deadlinePassed() {
  if (!deadline_ || std::chrono::steady_clock::now() < *deadline_) return false;
  if (!ready_) {
    setup_.log.log(LogLevel::warning,
                   "IpcConnection: Closing the connection of %s: not authenticated within %lld ms",
                   setup_.peer.c_str(), static_cast<long long>(setup_.limits.authentication.count()));
  }
  return true;
}

bool ConnectionLoop::outputPending() {
  uint64_t count = 0;
  return sd_bus_get_n_queued_write(bus_.get(), &count) < 0 || count > 0;
}

bool ConnectionLoop::wantsInput() {
  return !inputEnded_ && !outputPending() && unanswered_.size() < setup_.limits.unansweredCalls;
}

std::optional<ConnectionLoop::Wakeup> ConnectionLoop::wait() {
  const int events = sd_bus_get_events(bus_.get());
  if (events < 0) return std::nullopt;
  int wanted = events;
  if (ready_) {
    wanted = outputPending() ? POLLOUT : 0;
    if (wantsInput()) wanted |= POLLIN | POLLRDHUP;
  }
  std::array<pollfd, 2> descriptors{pollfd{busFd_, static_cast<short>(wanted), 0},
                                    pollfd{setup_.link->wakeDescriptor(), POLLIN, 0}};
  timespec timeout{};
  const bool inputAtHand = mayHoldInput_ && wantsInput();
  if (deadline_ && !inputAtHand) {
    const auto left = std::max(*deadline_ - std::chrono::steady_clock::now(), SteadyTime::duration::zero());
    const auto seconds = std::chrono::floor<std::chrono::seconds>(left);
    timeout.tv_sec = seconds.count();
    timeout.tv_nsec = std::chrono::nanoseconds(left - seconds).count();
  }
  const bool bounded = deadline_ || inputAtHand;
  const int count = ppoll(descriptors.data(), descriptors.size(), bounded ? &timeout : nullptr, nullptr);
  if (count < 0) return errno == EINTR ? std::optional(Wakeup{}) : std::nullopt;
  if ((descriptors[1].revents & POLLIN) != 0) setup_.link->drainWake();
  const auto got = static_cast<unsigned>(descriptors[0].revents);
  return Wakeup{inputAtHand || (got & (POLLIN | POLLOUT)) != 0, (got & (POLLHUP | POLLERR)) != 0,
                (got & POLLRDHUP) != 0};
}

bool ConnectionLoop::authenticate(const Wakeup& wakeup) {
  if (!wakeup.input) return !wakeup.hangup;
  if (sd_bus_process(bus_.get(), nullptr) < 0) return false;
  if (sd_bus_is_ready(bus_.get()) <= 0) return true;
  ready_ = true;
  mayHoldInput_ = true;
  deadline_.reset();
  return true;
}

bool ConnectionLoop::serve(const Wakeup& wakeup) {
  if (wakeup.hangup) return serveRest();
  if (!wakeup.input && !wakeup.inputEnded) return true;
  if (inputEnded_ || outputPending()) return writeOutput();
  for (int i = 0; i < kMessagesPerWakeup; ++i) {
    if (wakeup.inputEnded) {
      int unread = 0;
      if (!unreadBytes(unread) || unread == 0) {
        enterInterruption();
        return true;
      }
    }
    const uint64_t before = messages_;
    if (!countPartialMessage() || !processOnce()) return false;
    runTasks();
    if (messages_ == before || !wantsInput() || setup_.link->closed()) break;
  }
  return true;
}

// Should the library go on to look for input once it has written, it reads one message at most.
bool ConnectionLoop::writeOutput() {
  return sd_bus_process(bus_.get(), nullptr) >= 0;
}

// The client is gone. What it sent before is carried out; nothing is answered.
bool ConnectionLoop::serveRest() {
  peerGone_ = true;
  unanswered_.clear();
  // The error that answers unread by the client left behind would hide what it had sent.
  int error = 0;
  socklen_t size = sizeof(error);
  getsockopt(busFd_, SOL_SOCKET, SO_ERROR, &error, &size);
  while (countPartialMessage() && processOnce()) {
    int unread = 0;
    if (!unreadBytes(unread) || unread == 0) break;
    runTasks();
  }
  return false;
}

bool ConnectionLoop::processOnce() {
  const uint64_t before = messages_;
  const int r = sd_bus_process(bus_.get(), nullptr);
  if (messages_ == before) {
    ++quietReads_;
  } else {
    quietReads_ = 0;
    partialBytes_ = 0;
  }
  if (r == 0) mayHoldInput_ = false;
  if (r < 0 && r != -ECONNRESET && r != -EPIPE) {
    setup_.log.log(LogLevel::warning,
                   "IpcConnection: Closing the connection of %s: it broke the protocol: %s",
                   setup_.peer.c_str(), strerror(-r));
  }
  return r >= 0;
}

// The library takes messages of up to 128 MiB and has no setting for it. What it is about to read into an
// unfinished message is counted here instead.
bool ConnectionLoop::countPartialMessage() {
  if (quietReads_ < kFreeReads) return true;
  int unread = 0;
  if (!unreadBytes(unread)) return true;
  partialBytes_ += static_cast<size_t>(unread);
  if (partialBytes_ <= wire::kMaxMessageBytes) return true;
  setup_.log.log(LogLevel::warning,
                 "IpcConnection: Closing the connection of %s: a message exceeds the limit of %u bytes",
                 setup_.peer.c_str(), wire::kMaxMessageBytes);
  return false;
}

bool ConnectionLoop::unreadBytes(int& bytes) const {
  return ioctl(busFd_, FIONREAD, &bytes) == 0;
}

void ConnectionLoop::enterInterruption() {
  inputEnded_ = true;
  deadline_ = std::chrono::steady_clock::now() + setup_.limits.interruption;
  if (!setup_.interruptionHandler) return;
  try {
    setup_.interruptionHandler();
  } catch (const std::exception& error) {
    setup_.log.log(LogLevel::error, "IpcConnection: The interruption handler of %s failed: %s",
                   setup_.peer.c_str(), error.what());
  }
}

void ConnectionLoop::runTasks() {
  while (ready_ && !outputPending()) {
    auto task = setup_.link->takeTask();
    if (!task) return;
    task(*this);
  }
}

int ConnectionLoop::onMessage(sd_bus_message* message) {
  ++messages_;
  uint8_t type = 0;
  if (sd_bus_message_get_type(message, &type) < 0 || type != SD_BUS_MESSAGE_METHOD_CALL) return 1;
  const char* interface = sd_bus_message_get_interface(message);
  if (interface != nullptr && std::strcmp(interface, wire::kSessionInterface) == 0 &&
      std::strcmp(sd_bus_message_get_path(message), wire::kSessionPath) == 0) {
    onCall(message);
    return 1;
  }
  if (peerGone_) return 1;
  return answerGenericTool(message) ? 1 : 0;
}

void ConnectionLoop::onCall(sd_bus_message* message) {
  current_ = message;
  currentSerial_ = ++lastSerial_;
  currentAbandoned_ = false;
  runCall(message);
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

void ConnectionLoop::runCall(sd_bus_message* message) {
  const SessionCall call{message, *setup_.object, setup_.link, currentSerial_, setup_.peer, setup_.log};
  try {
    if (const MaybeError error = callSessionMethod(call)) {
      current_ = nullptr;
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
  if (peerGone_ || sd_bus_message_get_expect_reply(call) <= 0) return;
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
  const int r = peerGone_ ? -ECONNRESET : sd_bus_send(bus_.get(), message, nullptr);
  if (r >= 0) return std::nullopt;
  return Error(wire::kErrorFailed, -1, std::string("cannot call the client: ") + strerror(-r));
}

}  // namespace tarnel
