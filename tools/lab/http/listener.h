#pragma once

#include <cstdint>
#include <string>

#include "base/error.h"
#include "base/unique_fd.h"
#include "tools/files/file_io.h"

namespace tarnel::lab {

// Bound, and ready for what comes.
struct ListeningSocket {
  UniqueFd socket;
  uint16_t port = 0;
};

// A TCP socket that listens on the numeric address; port 0 takes a free one. The error names the fix;
// portOption is the command-line option that chooses the port.
Result<ListeningSocket> listenOn(const std::string& address, uint16_t port, const std::string& portOption);

// The same for UDP, and IPv4 only; the option chooses the port.
Result<ListeningSocket> receiveOn(const std::string& address, uint16_t port, const std::string& portOption);

// The IPv4 address that stands for the same: an IPv6 one is the loopback address, unless it is "::".
std::string ipv4Address(const std::string& address);

// 127.0.0.0/8 and ::1.
bool isLoopbackAddress(const std::string& address);
// For a URL: IPv6 in brackets; the wildcard addresses become loopback.
std::string urlHost(const std::string& address);

}  // namespace tarnel::lab
