#include "ipc/server/sd_bus_listener.h"

#include <fcntl.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "ipc/protocol/wire.h"
#include "ipc/server/peer_credentials.h"
#include "ipc/server/sd_bus_connection.h"

namespace tarnel {
namespace {

// Clients accepted before the loop gets to its other work.
constexpr int kAcceptsPerWakeup = 64;
constexpr std::chrono::seconds kRefusalLineEvery{1};
constexpr uint64_t kPauseMicroseconds = 100'000;

UniqueFd openReserve() {
  return UniqueFd(open("/dev/null", O_RDONLY | O_CLOEXEC));
}

Error eventFailure(int r) {
  return {wire::kErrorFailed, -r, std::string("cannot watch the socket: ") + std::strerror(-r)};
}

}  // namespace

SdBusListener::SdBusListener(sd_event* event, Options options, std::shared_ptr<Entitlements> entitlements,
                             std::shared_ptr<Log> log)
    : event_(sd_event_ref(event)),
      options_(std::move(options)),
      entitlements_(std::move(entitlements)),
      log_(std::move(log)),
      registry_(
          std::make_shared<ConnectionRegistry>(options_.limits, options_.trimHeap, options_.createThread)) {}

SdBusListener::~SdBusListener() {
  accepting_.reset();
  reaping_.reset();
  pause_.reset();
  trimming_.reset();
  const size_t left = registry_->stopAll();
  if (left == 0) return;
  log_->log(LogLevel::warning,
            "IpcListener: Calls that had not returned after %lld ms and are left behind: %zu",
            static_cast<long long>(options_.limits.ending.count()), left);
  if (options_.callsLeftBehind) options_.callsLeftBehind(left);
}

MaybeError SdBusListener::resume() {
  socket_ = ListeningSocket::fromServiceManager(wire::kServiceName);
  if (!socket_) {
    auto made = ListeningSocket::make(options_.runtimeDirectory + '/' + wire::kServiceName);
    if (!made) return made.error();
    socket_ = *std::move(made);
  }
  reserve_ = openReserve();
  const auto reap = [](sd_event_source*, int, uint32_t, void* self) {
    static_cast<SdBusListener*>(self)->tidyUp();
    return 0;
  };
  const auto accept = [](sd_event_source*, int, uint32_t, void* self) {
    static_cast<SdBusListener*>(self)->acceptWaiting();
    return 0;
  };
  if (MaybeError error = watch(registry_->finishedDescriptor(), reap, reaping_)) return error;
  return watch(socket_.get(), accept, accepting_);
}

MaybeError SdBusListener::watch(int descriptor, sd_event_io_handler_t handler, Source& source) {
  sd_event_source* made = nullptr;
  const int r = sd_event_add_io(event_.get(), &made, descriptor, EPOLLIN, handler, this);
  if (r < 0) return eventFailure(r);
  source.reset(made);
  return std::nullopt;
}

void SdBusListener::tidyUp() {
  registry_->reap();
  if (trimming_ == nullptr) trimHeap();
}

// Here because this thread keeps no message waiting.
void SdBusListener::trimHeap() {
  const auto wait = registry_->largeCalls().trimOwed();
  if (!wait) return;
  const auto again = [](sd_event_source*, uint64_t, void* self) {
    auto& listener = *static_cast<SdBusListener*>(self);
    listener.trimming_.reset();
    listener.trimHeap();
    return 0;
  };
  sd_event_source* made = nullptr;
  const auto microseconds = std::chrono::microseconds(*wait).count();
  // Without a timer it is done after the next large call.
  if (sd_event_add_time_relative(event_.get(), &made, CLOCK_MONOTONIC, static_cast<uint64_t>(microseconds), 0,
                                 again, this) >= 0) {
    trimming_.reset(made);
  }
}

void SdBusListener::acceptWaiting() {
  for (int i = 0; i < kAcceptsPerWakeup && acceptOne(); ++i) {
  }
}

// False when nobody waits any more.
bool SdBusListener::acceptOne() {
  UniqueFd socket(accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
  if (socket) {
    take(std::move(socket));
    return true;
  }
  if (errno == EAGAIN || errno == EWOULDBLOCK) return false;
  if (errno == EMFILE || errno == ENFILE) {
    outOfDescriptors(errno);
  } else if (errno != EINTR && errno != ECONNABORTED) {
    refused(std::string("accepting fails: ") + std::strerror(errno));
    pauseAccepting();
  }
  return false;
}

void SdBusListener::outOfDescriptors(int error) {
  reserve_.reset();
  UniqueFd victim(accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC));
  const bool closed = static_cast<bool>(victim);
  victim.reset();
  reserve_ = openReserve();
  if (closed) refused(std::string("the limit of open files is reached: ") + std::strerror(error));
  if (!closed || !reserve_) pauseAccepting();
}

// For failures that last: the waiting client would wake the loop at once again.
void SdBusListener::pauseAccepting() {
  if (sd_event_source_set_enabled(accepting_.get(), SD_EVENT_OFF) < 0) return;
  sd_event_source* made = nullptr;
  const auto go = [](sd_event_source*, uint64_t, void* self) {
    return sd_event_source_set_enabled(static_cast<SdBusListener*>(self)->accepting_.get(), SD_EVENT_ON);
  };
  if (sd_event_add_time_relative(event_.get(), &made, CLOCK_MONOTONIC, kPauseMicroseconds, 0, go, this) < 0) {
    sd_event_source_set_enabled(accepting_.get(), SD_EVENT_ON);
    return;
  }
  pause_.reset(made);
}

void SdBusListener::take(UniqueFd socket) {
  auto peer =
      options_.readCredentials ? options_.readCredentials(socket.get()) : readPeerCredentials(socket.get());
  auto place = registry_->enter(peer.uid);
  if (const auto* full = std::get_if<ConnectionRegistry::Full>(&place)) {
    refused(*full == ConnectionRegistry::Full::total
                ? "the limit of " + std::to_string(options_.limits.connections) + " connections is reached"
                : "the limit of " + std::to_string(options_.limits.connectionsPerUser) +
                      " connections per user is reached by user " + std::to_string(peer.uid));
    return;
  }
  const auto connection = std::make_shared<SdBusConnection>(
      std::move(socket),
      SdBusConnection::Setup{std::move(peer), std::get<ConnectionRegistry::Place>(std::move(place)),
                             registry_, entitlements_, log_, options_.limits, options_.clientFiles});
  bool accepted = false;
  try {
    accepted = delegate_ != nullptr && delegate_->shouldAcceptNewConnection(*this, connection);
  } catch (const std::exception& error) {
    log_->log(LogLevel::error, "IpcListener: Accepting %s failed: %s", connection->description().c_str(),
              error.what());
  }
  if (!accepted) connection->reject();
}

void SdBusListener::refused(const std::string& why) {
  ++refusedSinceLine_;
  const auto now = std::chrono::steady_clock::now();
  if (lastRefusalLine_ && now - *lastRefusalLine_ < kRefusalLineEvery) return;
  lastRefusalLine_ = now;
  log_->log(LogLevel::warning, "IpcListener: Connections closed: %zu; %s",
            std::exchange(refusedSinceLine_, 0), why.c_str());
}

}  // namespace tarnel
