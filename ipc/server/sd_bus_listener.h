#pragma once

#include <systemd/sd-event.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>

#include "base/log.h"
#include "base/unique_fd.h"
#include "ipc/entitlements.h"
#include "ipc/ipc.h"
#include "ipc/server/client_file_registry.h"
#include "ipc/server/connection_registry.h"
#include "ipc/server/ipc_limits.h"
#include "ipc/server/listening_socket.h"

namespace tarnel {

// Accepts clients on the service's socket: the one that the service manager passed, else its own in the
// runtime directory.
//
// Threads: made, resumed and destroyed on the thread that runs the event loop, which also calls the delegate.
// Its destruction ends all connections and waits for the calls that they are running, at most limits.ending:
// a client can hand over a descriptor whose very closing blocks.
class SdBusListener final : public IpcListener {
 public:
  struct Options {
    std::string runtimeDirectory;  // an absolute path
    IpcLimits limits;
    // Who is at the other end of an accepted socket; readPeerCredentials but for tests.
    std::function<PeerCredentials(int socket)> readCredentials;
    // Where files that clients hand over can be found; null: none are taken.
    std::shared_ptr<ClientFileRegistry> clientFiles;
    // Told by the destructor how many calls had to be left behind, if any: their threads still use the
    // delegate and all that it uses, so the process must end without destroying those.
    std::function<void(size_t)> callsLeftBehind;
    // pthread_create but for tests.
    ConnectionRegistry::CreateThread createThread = pthread_create;
    // Gives freed memory back to the system; on the event loop's thread, now and then after large calls.
    std::function<void()> trimHeap = LargeCalls::trimHeap;
  };

  // The event loop's reference is held.
  SdBusListener(sd_event* event, Options options, std::shared_ptr<Entitlements> entitlements,
                std::shared_ptr<Log> log);
  ~SdBusListener() override;

  void setDelegate(IpcListenerDelegate* delegate) override { delegate_ = delegate; }
  // The error says what to do about it.
  MaybeError resume() override;

  // For tests and status.
  size_t connections() const { return registry_->connections(); }
  size_t threads() const { return registry_->threads(); }

 private:
  struct UnrefEvent {
    void operator()(sd_event* event) const noexcept { sd_event_unref(event); }
  };
  struct UnrefSource {
    void operator()(sd_event_source* source) const noexcept { sd_event_source_disable_unref(source); }
  };
  using Source = std::unique_ptr<sd_event_source, UnrefSource>;

  MaybeError watch(int descriptor, sd_event_io_handler_t handler, Source& source);
  void tidyUp();
  void trimHeap();
  void acceptWaiting();
  bool acceptOne();
  void take(UniqueFd socket);
  void outOfDescriptors(int error);
  void pauseAccepting();
  void refused(const std::string& why);

  const std::unique_ptr<sd_event, UnrefEvent> event_;
  const Options options_;
  const std::shared_ptr<Entitlements> entitlements_;
  const std::shared_ptr<Log> log_;
  const std::shared_ptr<ConnectionRegistry> registry_;
  IpcListenerDelegate* delegate_ = nullptr;

  ListeningSocket socket_;
  // Given up to accept and close a client when the process has no descriptor left; otherwise it would stay
  // in the queue and wake the loop for ever.
  UniqueFd reserve_;
  Source accepting_;
  Source reaping_;
  Source pause_;
  Source trimming_;  // while memory waits to be given back

  // Closed connections are logged at most once a second, each line with the number since the last.
  std::optional<std::chrono::steady_clock::time_point> lastRefusalLine_;
  size_t refusedSinceLine_ = 0;
};

}  // namespace tarnel
