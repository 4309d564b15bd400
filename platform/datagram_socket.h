#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

#include "base/error.h"

namespace tarnel {

// Where an IPv4 datagram goes; both numbers in the host's byte order.
struct Ipv4Address {
  uint32_t address = 0;
  uint16_t port = 0;
  friend bool operator==(const Ipv4Address&, const Ipv4Address&) = default;
};

// An IPv4 UDP socket. No operation waits. Those that can fail return the error number, 0 for success.
//
// Threads: one at a time; the descriptor may be waited for on another.
class DatagramSocket {
 public:
  DatagramSocket() = default;
  DatagramSocket(const DatagramSocket&) = delete;
  DatagramSocket& operator=(const DatagramSocket&) = delete;
  virtual ~DatagramSocket() = default;  // closes

  virtual int descriptor() const noexcept = 0;  // -1 once closed
  // Sending on a connection that is gone gives an error and no signal.
  virtual void suppressBrokenPipeSignal() = 0;
  virtual int bindToWildcard() = 0;  // any address of this host, a port of the system's choice
  virtual int connectTo(const Ipv4Address& address) = 0;
  // Bytes that went out, -1 when none did: all, or the datagram is not on its way.
  virtual std::ptrdiff_t send(std::span<const uint8_t> datagram) = 0;
  // Takes the oldest datagram, cut to the buffer: its bytes, -1 when there is none or an error.
  virtual std::ptrdiff_t receive(std::span<uint8_t> buffer) = 0;
  virtual void close() = 0;
};

// Where sockets come from. Threads: any.
//
// This class itself is a source without any sockets.
class DatagramSockets {
 public:
  DatagramSockets() = default;
  DatagramSockets(const DatagramSockets&) = delete;
  DatagramSockets& operator=(const DatagramSockets&) = delete;
  virtual ~DatagramSockets() = default;

  // The error's code is the error number.
  virtual Result<std::unique_ptr<DatagramSocket>> create() = 0;

  static constexpr char kDatagramErrorDomain[] = "TarnelDatagramErrorDomain";
};

}  // namespace tarnel
