#include "tools/lab/http/listener.h"

#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <system_error>

#include "base/unique_fd.h"

namespace tarnel::lab {
namespace {

constexpr int kBacklog = 256;

Error listenError(const std::string& address, uint16_t port, const std::string& portOption, int errorNumber) {
  std::string text = "cannot listen on " + address + " port " + std::to_string(port) + ": " +
                     std::generic_category().message(errorNumber);
  if (errorNumber == EADDRINUSE) {
    text += "; end the other program, or choose another port with " + portOption + " (0 takes a free one)";
  } else if (errorNumber == EACCES) {
    text += "; ports below 1024 need privileges: choose another one with " + portOption;
  } else if (errorNumber == EADDRNOTAVAIL) {
    text += "; this machine has no such address: choose another one with --listen";
  }
  return Error(kToolErrorDomain, errorNumber, text);
}

Result<ListeningSocket> bindTo(const std::string& address, uint16_t port, const std::string& portOption,
                               int type) {
  addrinfo hints{};
  hints.ai_flags = AI_NUMERICHOST | AI_NUMERICSERV | AI_PASSIVE;
  hints.ai_socktype = type;
  addrinfo* found = nullptr;
  if (::getaddrinfo(address.c_str(), std::to_string(port).c_str(), &hints, &found) != 0 || found == nullptr) {
    return Error(kToolErrorDomain, EINVAL,
                 "\"" + address + "\" is no numeric address; --listen takes one like 127.0.0.1 or ::1");
  }
  const std::unique_ptr<addrinfo, decltype(&::freeaddrinfo)> guard(found, ::freeaddrinfo);
  ListeningSocket listening;
  listening.socket = UniqueFd(::socket(found->ai_family, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  const int on = 1;
  const bool stream = type == SOCK_STREAM;
  if (!listening.socket ||
      // For datagrams it would let two programs share the port.
      (stream && ::setsockopt(listening.socket.get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on) != 0) ||
      ::bind(listening.socket.get(), found->ai_addr, found->ai_addrlen) != 0 ||
      (stream && ::listen(listening.socket.get(), kBacklog) != 0)) {
    return listenError(address, port, portOption, errno);
  }
  sockaddr_storage bound{};
  socklen_t size = sizeof bound;
  if (::getsockname(listening.socket.get(), reinterpret_cast<sockaddr*>(&bound), &size) != 0) {
    return listenError(address, port, portOption, errno);
  }
  listening.port = ntohs(bound.ss_family == AF_INET6 ? reinterpret_cast<sockaddr_in6*>(&bound)->sin6_port
                                                     : reinterpret_cast<sockaddr_in*>(&bound)->sin_port);
  return listening;
}

}  // namespace

Result<ListeningSocket> listenOn(const std::string& address, uint16_t port, const std::string& portOption) {
  return bindTo(address, port, portOption, SOCK_STREAM);
}

Result<ListeningSocket> receiveOn(const std::string& address, uint16_t port, const std::string& portOption) {
  Result<ListeningSocket> bound = bindTo(ipv4Address(address), port, portOption, SOCK_DGRAM);
  if (!bound) return bound;
  // Room for a burst; as much as the system allows.
  const int bytes = 1 << 20;
  ::setsockopt(bound->socket.get(), SOL_SOCKET, SO_RCVBUF, &bytes, sizeof bytes);
  return bound;
}

std::string ipv4Address(const std::string& address) {
  in6_addr v6{};
  if (::inet_pton(AF_INET6, address.c_str(), &v6) != 1) return address;
  return IN6_IS_ADDR_UNSPECIFIED(&v6) ? "0.0.0.0" : "127.0.0.1";
}

bool isLoopbackAddress(const std::string& address) {
  in_addr v4{};
  if (::inet_pton(AF_INET, address.c_str(), &v4) == 1) return (ntohl(v4.s_addr) >> 24U) == 127;
  in6_addr v6{};
  return ::inet_pton(AF_INET6, address.c_str(), &v6) == 1 && IN6_IS_ADDR_LOOPBACK(&v6);
}

std::string urlHost(const std::string& address) {
  if (address == "0.0.0.0") return "127.0.0.1";
  in6_addr v6{};
  if (::inet_pton(AF_INET6, address.c_str(), &v6) != 1) return address;
  return IN6_IS_ADDR_UNSPECIFIED(&v6) ? "[::1]" : "[" + address + "]";
}

}  // namespace tarnel::lab
