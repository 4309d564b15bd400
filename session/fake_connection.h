#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "platform/ipc/ipc.h"

namespace tarnel::fake {

// A connection without a peer. Keeps what is sent to the client; the test interrupts and invalidates it.
// Threads: the proxy from any, the rest from one.
class FakeConnection final : public IpcConnection {
 public:
  struct ToClient {
    MaybeDictionary messageInfo;
    double timestamp;
    uint16_t category;
    uint16_t type;
    MaybeDictionary payload;
  };

  explicit FakeConnection(std::string name = "<connection>", bool entitled = true)
      : name_(std::move(name)), entitled_(entitled) {}

  std::string description() const override { return name_; }
  bool valueForEntitlement(std::string_view name) override {
    asked.emplace_back(name);
    return entitled_;
  }
  void setExportedObject(std::shared_ptr<ClientSessionInterface> object) override {
    exported = std::move(object);
  }
  void setRemoteObjectInterface() override { hasRemote = true; }
  void setInterruptionHandler(Handler handler) override { interruption_ = std::move(handler); }
  void setInvalidationHandler(Handler handler) override { invalidation_ = std::move(handler); }
  void resume() override { ++resumed; }

  std::shared_ptr<ClientSessionReplyInterface> remoteObjectProxyWithErrorHandler(
      ProxyErrorHandler errorHandler) override {
    const std::lock_guard guard(mutex_);
    if (proxyError_) {
      errorHandler(*proxyError_);
      return nullptr;
    }
    return std::make_shared<Proxy>(received_);
  }

  void interrupt() { interruption_(); }
  // As the real one: the handler runs once and everything is let go.
  void invalidate() {
    if (const auto handler = std::exchange(invalidation_, nullptr)) handler();
    interruption_ = nullptr;
    exported.reset();
  }
  void failProxies(Error error) {
    const std::lock_guard guard(mutex_);
    proxyError_ = std::move(error);
  }
  std::vector<ToClient> received() const { return received_->all(); }

  std::vector<std::string> asked;
  std::shared_ptr<ClientSessionInterface> exported;
  bool hasRemote = false;
  int resumed = 0;

 private:
  class Received {
   public:
    void add(ToClient message) {
      const std::lock_guard guard(mutex_);
      messages_.push_back(std::move(message));
    }
    std::vector<ToClient> all() const {
      const std::lock_guard guard(mutex_);
      return messages_;
    }

   private:
    mutable std::mutex mutex_;
    std::vector<ToClient> messages_;
  };
  class Proxy final : public ClientSessionReplyInterface {
   public:
    explicit Proxy(std::shared_ptr<Received> received) : received_(std::move(received)) {}
    void sendMessageToClient(MaybeDictionary messageInfo, double timestamp, uint16_t category, uint16_t type,
                             MaybeDictionary payload) override {
      received_->add({std::move(messageInfo), timestamp, category, type, std::move(payload)});
    }

   private:
    std::shared_ptr<Received> received_;
  };

  const std::string name_;
  const bool entitled_;
  std::mutex mutex_;
  MaybeError proxyError_;
  std::shared_ptr<Received> received_ = std::make_shared<Received>();
  Handler interruption_;
  Handler invalidation_;
};

}  // namespace tarnel::fake
