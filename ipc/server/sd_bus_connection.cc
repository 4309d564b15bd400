#include "ipc/server/sd_bus_connection.h"

#include <algorithm>
#include <cstring>
#include <utility>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/dbus/wire_size.h"
#include "ipc/protocol/wire.h"
#include "ipc/server/connection_loop.h"

namespace tarnel {
namespace {

std::string describe(const PeerCredentials& peer) {
  std::string text = "pid " + std::to_string(peer.pid) + ", user " +
                     (peer.uid == PeerCredentials::kNoId ? "unknown" : std::to_string(peer.uid));
  if (peer.process == nullptr) return text;
  if (auto executable = peer.process->executable()) {
    // A path may hold anything; what would break a log line must not.
    const auto isControl = [](char c) { return static_cast<unsigned char>(c) < 0x20 || c == 0x7F; };
    std::replace_if(executable->begin(), executable->end(), isControl, '?');
    text += ", " + *executable;
  }
  return text;
}

// The client's object as the daemon calls it.
class ReplyProxy final : public ClientSessionReplyInterface {
 public:
  ReplyProxy(std::shared_ptr<ConnectionLink> link, IpcConnection::ProxyErrorHandler errorHandler)
      : link_(std::move(link)),
        errorHandler_(std::make_shared<const IpcConnection::ProxyErrorHandler>(std::move(errorHandler))) {}

  void sendMessageToClient(MaybeDictionary messageInfo, double timestamp, uint16_t category, uint16_t type,
                           MaybeDictionary payload) override {
    const size_t bytes = kSmallAnswer + wire::approximateSize(messageInfo) + wire::approximateSize(payload);
    const auto posted = link_->post(
        bytes, [info = std::move(messageInfo), timestamp, category, type, payload = std::move(payload),
                errorHandler = errorHandler_](ConnectionLoop& loop) {
          const auto append = [&](sd_bus_message* m) {
            return appendAll(m, info, timestamp, category, type, payload);
          };
          const MaybeError error = loop.callClient(wire::kSendMessageToClient.name, append);
          if (error && *errorHandler) (*errorHandler)(*error);
        });
    if (posted == ConnectionLink::Posted::queued || !*errorHandler_) return;
    const char* why = posted == ConnectionLink::Posted::closed
                          ? "the connection is closed"
                          : "the client does not read; its connection is dropped";
    (*errorHandler_)(Error(wire::kErrorFailed, -1, why));
  }

 private:
  static MaybeError appendAll(sd_bus_message* m, const MaybeDictionary& info, double timestamp,
                              uint16_t category, uint16_t type, const MaybeDictionary& payload) {
    if (MaybeError error = wire::appendMaybeDictionary(m, info)) return error;
    if (sd_bus_message_append(m, "dqq", timestamp, category, type) < 0) {
      return Error(wire::kErrorFailed, -1, "the message cannot hold the call");
    }
    return wire::appendMaybeDictionary(m, payload);
  }

  std::shared_ptr<ConnectionLink> link_;
  std::shared_ptr<const IpcConnection::ProxyErrorHandler> errorHandler_;
};

}  // namespace

SdBusConnection::SdBusConnection(UniqueFd socket, Setup setup)
    : peer_(std::move(setup.peer)),
      description_(describe(peer_)),
      registry_(std::move(setup.registry)),
      entitlements_(std::move(setup.entitlements)),
      log_(std::move(setup.log)),
      limits_(setup.limits),
      clientFiles_(std::move(setup.clientFiles)),
      link_(std::make_shared<ConnectionLink>(limits_.queuedBytes)),
      place_(std::move(setup.place)),
      socket_(std::move(socket)) {}

bool SdBusConnection::valueForEntitlement(std::string_view name) {
  return entitlements_->holds(peer_, name);
}

void SdBusConnection::setExportedObject(std::shared_ptr<ClientSessionInterface> object) {
  object_ = std::move(object);
}

void SdBusConnection::setRemoteObjectInterface() {
  hasRemoteInterface_ = true;
}

void SdBusConnection::setInterruptionHandler(Handler handler) {
  interruptionHandler_ = std::move(handler);
}

void SdBusConnection::setInvalidationHandler(Handler handler) {
  invalidationHandler_ = std::move(handler);
}

bool SdBusConnection::resume() {
  if (resumed_) return true;
  if (object_ == nullptr) {
    log_->log(LogLevel::error, "IpcConnection: No object is exported to %s", description_.c_str());
    return false;
  }
  const int error = registry_->start(link_, [self = shared_from_this()] { self->serve(); });
  resumed_ = error == 0;
  if (!resumed_) {
    log_->log(LogLevel::error, "IpcConnection: Closing the connection of %s: no thread can be started: %s",
              description_.c_str(), strerror(error));
  }
  return resumed_;
}

void SdBusConnection::serve() {
  ConnectionLoop::Setup setup{link_,
                              object_,
                              std::move(interruptionHandler_),
                              description_,
                              limits_,
                              *log_,
                              clientFiles_.get(),
                              registry_->largeCalls(),
                              peer_.uid};
  interruptionHandler_ = nullptr;
  {
    ConnectionLoop loop(std::move(setup), std::move(socket_));
    loop.run();
  }
  invalidate();
}

void SdBusConnection::invalidate() {
  link_->close();
  socket_.reset();
  place_.reset();
  interruptionHandler_ = nullptr;
  if (const Handler handler = std::exchange(invalidationHandler_, nullptr)) {
    try {
      handler();
    } catch (const std::exception& error) {
      log_->log(LogLevel::error, "IpcConnection: The invalidation handler of %s failed: %s",
                description_.c_str(), error.what());
    }
  }
  object_.reset();
}

void SdBusConnection::reject() {
  if (resumed_) {
    link_->stop("it was not accepted");
    return;
  }
  resumed_ = true;
  invalidationHandler_ = nullptr;
  invalidate();
}

std::shared_ptr<ClientSessionReplyInterface> SdBusConnection::remoteObjectProxyWithErrorHandler(
    ProxyErrorHandler errorHandler) {
  if (hasRemoteInterface_ && !link_->closed()) {
    return std::make_shared<ReplyProxy>(link_, std::move(errorHandler));
  }
  const char* why = hasRemoteInterface_ ? "the connection is closed" : "the client has no object to call";
  if (errorHandler) errorHandler(Error(wire::kErrorFailed, -1, why));
  return nullptr;
}

}  // namespace tarnel
