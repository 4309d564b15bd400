#pragma once

#include <memory>

#include "tools/lab/http/listener.h"
#include "tools/lab/receivers/datagram_receiver.h"
#include "tools/receiving/notices.h"

namespace tarnel::lab {

// One UDP socket and the thread that reads it.
class DatagramServer {
 public:
  // Reads what comes from now on. receiver and notices outlive the server.
  static std::unique_ptr<DatagramServer> start(ListeningSocket socket, DatagramReceiver& receiver,
                                               Notices& notices);

  DatagramServer() = default;
  DatagramServer(const DatagramServer&) = delete;
  DatagramServer& operator=(const DatagramServer&) = delete;
  virtual ~DatagramServer() = default;

  // Returns when the thread has ended; what the socket held until then has been read, unless still more came
  // all the time. Idempotent.
  virtual void stop() = 0;
};

}  // namespace tarnel::lab
