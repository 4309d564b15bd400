#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "base/unique_fd.h"

namespace tarnel::test {

// A connection to the daemon's socket without any library: bytes of the caller's choice.
class RawBusClient {
 public:
  explicit RawBusClient(const std::string& socketPath);

  bool isConnected() const { return static_cast<bool>(socket_); }
  const UniqueFd& socket() const { return socket_; }

  // False when the daemon takes no more. Blocks while it reads nothing, at most for the common deadline.
  bool write(std::string_view bytes) const;
  // As much as fits at once; how much that was, or -1 when the connection is gone.
  ssize_t writeSome(std::string_view bytes) const;
  // The handshake, as a client does it that shows nothing of itself.
  bool authenticate() const;
  // Waits for the daemon to close, reading what it says until then; false when it does not.
  bool isClosedByDaemon() const;
  // Waits for an answer of any kind; empty when the daemon closes.
  std::string readSome() const;
  void close() { socket_.reset(); }

 private:
  UniqueFd socket_;
};

// A method call of the session interface as it goes over the wire. bodySize may lie; a call without
// `wantsReply` is not answered.
struct RawCall {
  std::string_view member;
  std::string_view signature = {};
  std::string_view body = {};
  uint32_t serial = 1;
  bool wantsReply = true;
  uint32_t bodySize = UINT32_MAX;  // the true one
  std::string_view path = "/com/orvane/tarneld";
  std::string_view interface = "com.orvane.tarneld.ClientSession";
};
std::string bytesOf(const RawCall& call);

// Arguments of SendMessage: category, type and either no payload or one text under "text".
std::string messageBody(uint16_t category, uint16_t type);
std::string messageBody(uint16_t category, uint16_t type, std::string_view text);

}  // namespace tarnel::test
