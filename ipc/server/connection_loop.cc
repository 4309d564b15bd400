#include "ipc/server/connection_loop.h"

#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <exception>
#include <iterator>
#include <utility>

#include "ipc/protocol/wire.h"

namespace tarnel {
namespace {

// Steps of input before the descriptors and tasks are looked at again.
constexpr int kStepsPerWakeup = 64;
constexpr size_t kBufferBytes = size_t{16} << 10U;
// Room of the way to the bus: what it has not read yet is held by the kernel.
constexpr int kFeedBytes = 16 << 10;

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
  std::array<int, 2> ends{-1, -1};
  int r = socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()) == 0 ? 0 : -errno;
  UniqueFd readEnd(ends[0]);
  feed_.reset(ends[1]);
  if (r >= 0) setsockopt(feed_.get(), SOL_SOCKET, SO_SNDBUF, &kFeedBytes, sizeof(kFeedBytes));
  sd_bus* made = nullptr;
  if (r >= 0) r = sd_bus_new(&made);
  bus_.reset(made);
  if (r >= 0) r = sd_bus_set_fd(made, readEnd.get(), socket_.get());
  if (r >= 0) {
    readEnd.release();
    busFd_ = socket_.release();
  }
  if (r >= 0) r = sd_bus_set_server(made, 1, randomId());
  if (r >= 0) r = sd_bus_set_anonymous(made, 1);
  if (r >= 0) r = sd_bus_negotiate_fds(made, 1);
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
  return !stopWanted() && !deadlinePassed() && wait() && serve();
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
  const int events = sd_bus_get_events(bus_.get());
  return events > 0 && (events & POLLOUT) != 0;
}

bool ConnectionLoop::wantsInput() {
  return peerGone_ || (!outputPending() && unanswered_.size() < setup_.limits.unansweredCalls);
}

bool ConnectionLoop::inputAtHand() const {
  return isFed_ || admitted_ > 0 || isNew_ || mayHaveMore_;
}

// False when the bus is closed.
bool ConnectionLoop::wait() {
  if (sd_bus_get_events(bus_.get()) < 0) return false;
  const bool isReading = wantsInput();
  const bool isBusy = isReading && inputAtHand();
  if (!isBusy && inputBegin_ == inputEnd_) {
    buffer_.reset();
    capacity_ = 0;
    inputBegin_ = 0;
    inputEnd_ = 0;
  }
  unsigned wanted = outputPending() ? POLLOUT : 0;
  if (isReading && !inputEnded_) wanted |= POLLIN;
  std::array<pollfd, 2> descriptors{pollfd{busFd_, static_cast<short>(wanted), 0},
                                    pollfd{setup_.link->wakeDescriptor(), POLLIN, 0}};
  timespec timeout{};
  if (deadline_ && !isBusy) {
    const auto left = std::max(*deadline_ - std::chrono::steady_clock::now(), SteadyTime::duration::zero());
    const auto seconds = std::chrono::floor<std::chrono::seconds>(left);
    timeout.tv_sec = seconds.count();
    timeout.tv_nsec = std::chrono::nanoseconds(left - seconds).count();
  }
  const bool isBounded = deadline_ || isBusy;
  if (ppoll(descriptors.data(), descriptors.size(), isBounded ? &timeout : nullptr, nullptr) < 0) {
    return errno == EINTR;
  }
  if ((descriptors[1].revents & POLLIN) != 0) setup_.link->drainWake();
  const auto got = static_cast<unsigned>(descriptors[0].revents);
  if ((got & POLLIN) != 0) mayHaveMore_ = true;
  if ((got & (POLLHUP | POLLERR)) != 0) peerIsGone();
  return true;
}

bool ConnectionLoop::serve() {
  if (outputPending() && processOnce() == Pump::over) return false;
  for (int i = 0; i < kStepsPerWakeup && wantsInput() && !setup_.link->closed(); ++i) {
    const Pump pumped = pump();
    if (pumped == Pump::over) return false;
    if (pumped == Pump::progress) {
      runTasks();
      continue;
    }
    if (peerGone_ || (inputEnded_ && !ready_)) return false;
    return !inputEnded_ || interrupted_ || enterInterruption();
  }
  return true;
}

// One step of input, the one nearest to the bus first.
ConnectionLoop::Pump ConnectionLoop::pump() {
  if (isFed_) return processOnce();
  if (admitted_ > 0) return feed();
  if (isNew_) return examine();
  return mayHaveMore_ ? receive() : Pump::idle;
}

ConnectionLoop::Pump ConnectionLoop::processOnce() {
  const int r = sd_bus_process(bus_.get(), nullptr);
  if (r == -ECONNRESET || r == -EPIPE) return Pump::over;
  if (r < 0) return closing(std::string("it broke the protocol: ") + strerror(-r));
  if (isOutOfStep_) return closing("it broke the protocol: a message where none was seen");
  const bool isDone = admitted_ == 0 && messages_ == framer_.completed() && ready_;
  if (r == 0 || isDone) isFed_ = false;
  // The library drops what it finds malformed without a word; a peer that sends such is not to be trusted
  // with the rest.
  if (r == 0 && ready_ && admitted_ == 0 && messages_ < framer_.completed()) {
    return closing("it broke the protocol: a malformed message");
  }
  if (!ready_ && sd_bus_is_ready(bus_.get()) > 0) {
    ready_ = true;
    mayPassDescriptors_ = sd_bus_can_send(bus_.get(), SD_BUS_TYPE_UNIX_FD) > 0;
    deadline_.reset();
  }
  return Pump::progress;
}

ConnectionLoop::Pump ConnectionLoop::feed() {
  // A send that failed has closed it; nobody reads the pipe any more.
  if (sd_bus_is_open(bus_.get()) <= 0) return Pump::over;
  const auto written =
      ::send(feed_.get(), buffer_.get() + inputBegin_, admitted_, MSG_DONTWAIT | MSG_NOSIGNAL);
  // Parts of messages that the bus has not read yet may fill it.
  if (written < 0 && errno == EAGAIN) {
    isFed_ = true;
    return Pump::progress;
  }
  if (written <= 0) return closing(std::string("its input cannot be passed on: ") + strerror(errno));
  inputBegin_ += static_cast<size_t>(written);
  admitted_ -= static_cast<size_t>(written);
  isFed_ = true;
  return Pump::progress;
}

ConnectionLoop::Pump ConnectionLoop::receive() {
  makeRoom(std::max(kBufferBytes, std::exchange(wanted_, 0)));
  const size_t room = capacity_ - inputEnd_;
  const auto got = receiveWithDescriptors(busFd_, buffer_.get() + inputEnd_, room, descriptors_);
  if (got < 0 && errno == ECONNRESET && !peerGone_) {
    // It closed with answers unread. What it had sent comes with the next read.
    peerIsGone();
    return Pump::progress;
  }
  mayHaveMore_ = got == static_cast<ssize_t>(room);
  if (got == 0) inputEnded_ = true;
  if (got <= 0) return got == 0 || errno == EAGAIN || errno == EINTR ? Pump::idle : Pump::over;
  if (descriptors_.size() > wire::kMaxDescriptors) {
    return closing("more than " + std::to_string(wire::kMaxDescriptors) +
                   " descriptors came with part of a message");
  }
  inputEnd_ += static_cast<size_t>(got);
  isNew_ = true;
  return Pump::progress;
}

// What is left in the buffer goes to its front: a part of a message that is to be looked at as a whole.
void ConnectionLoop::makeRoom(size_t capacity) {
  const size_t left = inputEnd_ - inputBegin_;
  if (capacity_ >= capacity) {
    std::memmove(buffer_.get(), buffer_.get() + inputBegin_, left);
  } else {
    auto larger = std::make_unique_for_overwrite<char[]>(capacity);
    if (left > 0) std::memcpy(larger.get(), buffer_.get() + inputBegin_, left);
    buffer_ = std::move(larger);
    capacity_ = capacity;
  }
  inputBegin_ = 0;
  inputEnd_ = left;
}

std::string_view ConnectionLoop::unadmitted() const {
  return {buffer_.get() + inputBegin_, inputEnd_ - inputBegin_};
}

// Looks at what was received. The bus has read everything before it.
ConnectionLoop::Pump ConnectionLoop::examine() {
  isNew_ = false;
  // The bus has read the last line, and would let another follow: it must not go on with lines where we see
  // messages.
  if (!framer_.isAuthenticating() && !ready_) {
    return closing("it broke the protocol: its authentication did not end with BEGIN");
  }
  const auto input = unadmitted();
  if (input.empty()) {
    dropDescriptors();
    return Pump::progress;
  }
  if (framer_.isAuthenticating()) {
    const auto lines = framer_.admitAuthentication(input);
    if (!lines) return closing(framer_.refusal());
    admitted_ = *lines;
    isNew_ = true;
    return Pump::progress;
  }
  if (!framer_.isBetweenMessages()) return admit(std::min(input.size(), framer_.restOfMessage()));
  const auto size = framer_.sizeOfNext(input);
  if (!size) return closing(framer_.refusal());
  messageBytes_ = *size;
  foundNoRoom_ = false;
  if (*size != 0 && !descriptors_.empty()) {
    if (const auto claimed = claimDescriptors(*size)) return *claimed;
  }
  if (*size == 0 || input.size() < std::min(*size, kSendCallStart)) return Pump::progress;
  const auto message = input.substr(0, *size);
  if (!mayBeSendCall(message)) return admit(message.size());
  if (message.size() < *size) {
    wanted_ = *size;
    return Pump::progress;
  }
  const auto place = waitForTurn(LargeCalls::Kind::prompt);
  if (!place && messageBytes_ > setup_.limits.largeMessage) {
    // The library reads as much of it as an answer needs.
    foundNoRoom_ = true;
    return admit(message.size());
  }
  auto call = readSendCall(message);
  if (!call) return admit(message.size());
  framer_.passMessage();
  ++messages_;
  inputBegin_ += message.size();
  isNew_ = true;
  onSendCall(*std::move(call));
  return Pump::progress;
}

ConnectionLoop::Pump ConnectionLoop::admit(size_t bytes) {
  const auto admitted = framer_.admit(unadmitted().substr(0, bytes));
  if (!admitted) return closing(framer_.refusal());
  admitted_ = *admitted;
  isNew_ = admitted_ > 0;
  if (!announced_.empty()) lastNumber_.add(unadmitted().substr(0, admitted_));
  return Pump::progress;
}

// Gives the next message the descriptors that it announces. Nothing when it announces none.
std::optional<ConnectionLoop::Pump> ConnectionLoop::claimDescriptors(size_t sizeOfMessage) {
  const auto input = unadmitted();
  const size_t header = headerSize(input);
  if (header > kMaxHeaderWithDescriptors)
    return closing("the header of a message with descriptors is too long");
  if (input.size() < header) return Pump::progress;
  const auto announced = announcedDescriptors(input);
  if (!announced) return closing("it broke the protocol: a malformed message");
  if (*announced == 0 || !mayPassDescriptors_) {
    // They can only belong to a message whose first byte has come.
    if (!mayPassDescriptors_ || input.size() <= sizeOfMessage) dropDescriptors();
    return std::nullopt;
  }
  if (*announced > descriptors_.size()) {
    return closing("a message announces " + std::to_string(*announced) + " descriptors, and " +
                   std::to_string(descriptors_.size()) + " came; at most " +
                   std::to_string(wire::kMaxDescriptors) + " may");
  }
  const auto end = descriptors_.begin() + static_cast<std::ptrdiff_t>(*announced);
  announced_.assign(std::make_move_iterator(descriptors_.begin()), std::make_move_iterator(end));
  descriptors_.erase(descriptors_.begin(), end);
  announceNoDescriptors({buffer_.get() + inputBegin_, header});
  lastNumber_.begin(input.front());
  return admit(std::min(sizeOfMessage, input.size()));
}

void ConnectionLoop::dropDescriptors() {
  if (descriptors_.empty()) return;
  if (!std::exchange(toldOfDescriptors_, true)) {
    setup_.log.log(LogLevel::warning, "IpcConnection: Descriptors of %s that no message announces are closed",
                   setup_.peer.c_str());
  }
  descriptors_.clear();
}

ConnectionLoop::Pump ConnectionLoop::closing(const std::string& why) {
  setup_.log.log(LogLevel::warning, "IpcConnection: Closing the connection of %s: %s", setup_.peer.c_str(),
                 why.c_str());
  return Pump::over;
}

// Looked at before anything is sent: a failed send closes the bus, and with it what the client had sent
// before it died would be lost unread.
bool ConnectionLoop::isPeerGone() {
  pollfd descriptor{busFd_, 0, 0};
  if (!peerGone_ && poll(&descriptor, 1, 0) > 0) peerIsGone();
  return peerGone_;
}

// What it sent before is still carried out; nothing is answered.
void ConnectionLoop::peerIsGone() {
  peerGone_ = true;
  mayHaveMore_ = !inputEnded_;
  unanswered_.clear();
}

bool ConnectionLoop::enterInterruption() {
  interrupted_ = true;
  deadline_ = std::chrono::steady_clock::now() + setup_.limits.interruption;
  if (!setup_.interruptionHandler) return true;
  try {
    setup_.interruptionHandler();
  } catch (const std::exception& error) {
    setup_.log.log(LogLevel::error, "IpcConnection: The interruption handler of %s failed: %s",
                   setup_.peer.c_str(), error.what());
  }
  return true;
}

void ConnectionLoop::runTasks() {
  while (ready_ && !outputPending()) {
    auto task = setup_.link->takeTask();
    if (!task) return;
    task(*this);
  }
}

}  // namespace tarnel
