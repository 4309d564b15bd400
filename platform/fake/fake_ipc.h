#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "ipc/ipc.h"

namespace tarnel::fake {

// One call of the client's object.
struct SentToClient {
  MaybeDictionary messageInfo;
  double timestamp = 0;
  uint16_t category = 0;
  uint16_t type = 0;
  MaybeDictionary payload;
  friend bool operator==(const SentToClient&, const SentToClient&) = default;
};

// A connection whose client is the test. Threads: any for what IpcConnection allows; the fields are the
// test's.
class FakeIpcConnection final : public IpcConnection {
 public:
  explicit FakeIpcConnection(std::string description = "pid 1, user 1000")
      : describedAs(std::move(description)) {}

  // What the test decides.
  std::string describedAs;
  std::map<std::string, bool, std::less<>> entitlements;
  // When set, there is no way to the client and proxies fail with this.
  MaybeError proxyError;
  // Whether it can be served: false is a system that gives no thread.
  bool canBeServed = true;
  // Run when the daemon resumes the connection, and when it asks for the client's object.
  Handler whenResumed;
  Handler whenProxyIsAsked;

  // What the daemon did.
  std::shared_ptr<ClientSessionInterface> exportedObject;
  bool hasRemoteObjectInterface = false;
  Handler interruptionHandler;
  Handler invalidationHandler;
  bool isResumed = false;
  std::atomic<bool> isInvalidated{false};

  std::vector<SentToClient> sentToClient() const {
    const std::lock_guard lock(sent_->mutex);
    return sent_->calls;
  }

  // The client went quiet.
  void interrupt() {
    if (interruptionHandler) interruptionHandler();
  }
  // The client is gone. Runs the handler once and lets go of both handlers and the object.
  void invalidate() {
    if (isInvalidated.exchange(true)) return;
    interruptionHandler = nullptr;
    if (const Handler handler = std::exchange(invalidationHandler, nullptr)) handler();
    exportedObject.reset();
  }

  std::string description() const override { return describedAs; }
  bool valueForEntitlement(std::string_view name) override {
    const auto found = entitlements.find(name);
    return found != entitlements.end() && found->second;
  }
  void setExportedObject(std::shared_ptr<ClientSessionInterface> object) override {
    exportedObject = std::move(object);
  }
  void setRemoteObjectInterface() override { hasRemoteObjectInterface = true; }
  void setInterruptionHandler(Handler handler) override { interruptionHandler = std::move(handler); }
  void setInvalidationHandler(Handler handler) override { invalidationHandler = std::move(handler); }
  bool resume() override {
    isResumed = canBeServed;
    if (whenResumed) whenResumed();
    return isResumed;
  }
  std::shared_ptr<ClientSessionReplyInterface> remoteObjectProxyWithErrorHandler(
      ProxyErrorHandler errorHandler) override {
    if (whenProxyIsAsked) whenProxyIsAsked();
    if (!proxyError && hasRemoteObjectInterface && !isInvalidated) return std::make_shared<Proxy>(sent_);
    if (errorHandler) errorHandler(proxyError.value_or(Error("fake", -1, "no way to the client")));
    return nullptr;
  }

 private:
  struct Sent {
    std::mutex mutex;
    std::vector<SentToClient> calls;
  };
  class Proxy final : public ClientSessionReplyInterface {
   public:
    explicit Proxy(std::shared_ptr<Sent> sent) : sent_(std::move(sent)) {}
    void sendMessageToClient(MaybeDictionary messageInfo, double timestamp, uint16_t category, uint16_t type,
                             MaybeDictionary payload) override {
      const std::lock_guard lock(sent_->mutex);
      sent_->calls.push_back({std::move(messageInfo), timestamp, category, type, std::move(payload)});
    }

   private:
    std::shared_ptr<Sent> sent_;
  };

  const std::shared_ptr<Sent> sent_ = std::make_shared<Sent>();
};

// A listener to which the test connects.
class FakeIpcListener final : public IpcListener {
 public:
  IpcListenerDelegate* delegate = nullptr;
  bool isResumed = false;
  // When set, resuming fails with this.
  MaybeError resumeError;

  // A client connects. Returns whether it was accepted; a rejected connection is let go of, as a real one.
  bool connect(const std::shared_ptr<FakeIpcConnection>& connection) {
    if (delegate != nullptr && delegate->shouldAcceptNewConnection(*this, connection)) return true;
    connection->interruptionHandler = nullptr;
    connection->invalidationHandler = nullptr;
    connection->exportedObject.reset();
    return false;
  }

  void setDelegate(IpcListenerDelegate* newDelegate) override { delegate = newDelegate; }
  MaybeError resume() override {
    isResumed = !resumeError;
    return resumeError;
  }
};

}  // namespace tarnel::fake
