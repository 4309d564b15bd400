#pragma once

#include <deque>
#include <memory>
#include <optional>
#include <vector>

#include "client/src/connection.h"
#include "client/src/lifetime.h"
#include "client/src/mailbox.h"
#include "client/src/options.h"

namespace tarnel::core {

// What a session's I/O thread does: connect, send what waits, receive, run callbacks.
//
// Threads: everything on the I/O thread.
class IoLoop final : public Connection::Host {
 public:
  // All but the options are not owned and outlive the loop. socket: where the connection's descriptor is
  // noted for a fork.
  IoLoop(const Options& options, const Handlers& handlers, Mailbox& mailbox, ForkVisibleDescriptor& socket);
  ~IoLoop() override;

  // Until closing is wanted and has been done.
  void run();

  // Completions that must not run any more because the process is ending; kept, so that what they hold is
  // not let go while other threads wind down.
  std::vector<Completion> takeParked() { return std::move(parked_); }

 private:
  void answered(Request& request, const Answer& answer) override;
  void aggregated(const MaybeDictionary& messageInfo, double timestamp, uint16_t category, uint16_t type,
                  const MaybeDictionary& payload) override;

  void beginConnecting();
  void tryToConnect();
  void serve();
  void sendWaiting();
  bool hasClosed(const Mailbox::Orders& orders);
  void wait(const Mailbox::Orders& orders);
  bool canSend() const;
  void disconnect(State state, const Outcome& why);
  Outcome whyLost(const Outcome& lost) const;

  const Options options_;
  const std::string path_;
  const Handlers& handlers_;
  Mailbox& mailbox_;
  ForkVisibleDescriptor& socket_;

  std::unique_ptr<Connection> connection_;
  bool isConnecting_ = false;  // from the wish to connect until the daemon let us in
  bool isReady_ = false;
  SteadyTime connectBy_;
  std::vector<Completion> parked_;
};

}  // namespace tarnel::core
