#pragma once

#include <memory>

#include "platform/datagram_socket.h"

namespace tarnel {

// Sockets of the kernel's, never blocking and closed on exec.
class UdpSockets final : public DatagramSockets {
 public:
  Result<std::unique_ptr<DatagramSocket>> create() override;
};

}  // namespace tarnel
