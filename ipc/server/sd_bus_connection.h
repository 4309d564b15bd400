#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/log.h"
#include "base/unique_fd.h"
#include "ipc/entitlements.h"
#include "ipc/ipc.h"
#include "ipc/server/client_file_registry.h"
#include "ipc/server/connection_link.h"
#include "ipc/server/connection_registry.h"
#include "ipc/server/ipc_limits.h"

namespace tarnel {

// A client's connection over one Unix stream socket, D-Bus messages peer to peer.
class SdBusConnection final : public IpcConnection, public std::enable_shared_from_this<SdBusConnection> {
 public:
  struct Setup {
    PeerCredentials peer;
    ConnectionRegistry::Place place;
    std::shared_ptr<ConnectionRegistry> registry;
    std::shared_ptr<Entitlements> entitlements;
    std::shared_ptr<Log> log;
    IpcLimits limits;
    std::shared_ptr<ClientFileRegistry> clientFiles;  // may be null
  };
  SdBusConnection(UniqueFd socket, Setup setup);

  std::string description() const override { return description_; }
  bool valueForEntitlement(std::string_view name) override;
  void setExportedObject(std::shared_ptr<ClientSessionInterface> object) override;
  void setRemoteObjectInterface() override;
  void setInterruptionHandler(Handler handler) override;
  void setInvalidationHandler(Handler handler) override;
  bool resume() override;
  std::shared_ptr<ClientSessionReplyInterface> remoteObjectProxyWithErrorHandler(
      ProxyErrorHandler errorHandler) override;

  // The delegate does not want it. Closes the socket and lets go of everything.
  void reject();

 private:
  void serve();
  void invalidate();

  const PeerCredentials peer_;
  const std::string description_;
  const std::shared_ptr<ConnectionRegistry> registry_;
  const std::shared_ptr<Entitlements> entitlements_;
  const std::shared_ptr<Log> log_;
  const IpcLimits limits_;
  const std::shared_ptr<ClientFileRegistry> clientFiles_;
  const std::shared_ptr<ConnectionLink> link_;

  // Written before resume(), then by the connection's thread.
  std::optional<ConnectionRegistry::Place> place_;
  UniqueFd socket_;
  std::shared_ptr<ClientSessionInterface> object_;
  Handler interruptionHandler_;
  Handler invalidationHandler_;
  bool hasRemoteInterface_ = false;
  bool resumed_ = false;
};

}  // namespace tarnel
