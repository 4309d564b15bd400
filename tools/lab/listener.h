#pragma once

#include <cstdint>
#include <string>

#include "platform/base/error.h"
#include "tools/storebag/file_io.h"

namespace tarnel::lab {

struct ListeningSocket {
  FileDescriptor socket;
  uint16_t port = 0;
};

// A TCP socket that listens on the numeric address; port 0 takes a free one. The error names the fix;
// portOption is the command-line option that chooses the port.
Result<ListeningSocket> listenOn(const std::string& address, uint16_t port, const std::string& portOption);

// 127.0.0.0/8 and ::1.
bool isLoopbackAddress(const std::string& address);
// For a URL: IPv6 in brackets; the wildcard addresses become loopback.
std::string urlHost(const std::string& address);

}  // namespace tarnel::lab
