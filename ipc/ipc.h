#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "base/error.h"
#include "ipc/protocol/client_session_interface.h"

// The IPC service as the daemon sees it.

namespace tarnel {

// One client's connection, on the daemon's side.
//
// It is served by a thread of its own, which runs the calls of the exported object and both handlers.
// Threads: every operation may be called from any thread, unless noted.
class IpcConnection {
 public:
  using Handler = std::function<void()>;
  using ProxyErrorHandler = std::function<void(const Error&)>;

  IpcConnection() = default;
  IpcConnection(const IpcConnection&) = delete;
  IpcConnection& operator=(const IpcConnection&) = delete;
  virtual ~IpcConnection() = default;

  // For logs: process id, user and program as far as they are known.
  virtual std::string description() const = 0;

  // The boolean entitlement of the peer; false when it has none of that name. Decided from what the kernel
  // says about the peer, never from what the peer says.
  virtual bool valueForEntitlement(std::string_view name) = 0;

  // The four setters are for shouldAcceptNewConnection, before resume().
  // The exported interface is ClientSessionInterface; the connection holds the object until it is
  // invalidated.
  virtual void setExportedObject(std::shared_ptr<ClientSessionInterface> object) = 0;
  // Declares that the peer implements ClientSessionReplyInterface; without it there is no proxy.
  virtual void setRemoteObjectInterface() = 0;
  // The peer went quiet without going away; may run more than once.
  virtual void setInterruptionHandler(Handler handler) = 0;
  // The connection, once resumed, is gone for good. Runs exactly once, on the connection's thread, after the
  // last call of the exported object has returned, and is released with everything it captured right after it
  // ran.
  virtual void setInvalidationHandler(Handler handler) = 0;
  // Starts serving. False, logged, when that cannot be: nothing of the connection will run then, the handlers
  // included, and the delegate gives up what it holds for it and returns false.
  [[nodiscard]] virtual bool resume() = 0;

  // The peer's object. Calls are queued and never block; when one cannot be delivered the error handler
  // runs (on any thread). Null, after the error handler ran, when there is no way to the peer.
  virtual std::shared_ptr<ClientSessionReplyInterface> remoteObjectProxyWithErrorHandler(
      ProxyErrorHandler errorHandler) = 0;
};

class IpcListener;

class IpcListenerDelegate {
 public:
  IpcListenerDelegate() = default;
  IpcListenerDelegate(const IpcListenerDelegate&) = delete;
  IpcListenerDelegate& operator=(const IpcListenerDelegate&) = delete;
  virtual ~IpcListenerDelegate() = default;

  // listener:shouldAcceptNewConnection:
  // True keeps the connection (the delegate has called resume(), which was true); false closes it. Must not
  // block.
  virtual bool shouldAcceptNewConnection(IpcListener& listener,
                                         std::shared_ptr<IpcConnection> connection) = 0;
};

class IpcListener {
 public:
  IpcListener() = default;
  IpcListener(const IpcListener&) = delete;
  IpcListener& operator=(const IpcListener&) = delete;
  virtual ~IpcListener() = default;

  // Not owned; must outlive the listener. Set before resume().
  virtual void setDelegate(IpcListenerDelegate* delegate) = 0;
  // Opens the named service and begins to accept.
  virtual MaybeError resume() = 0;
};

}  // namespace tarnel
