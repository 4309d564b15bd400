#include "testing/http_request.h"

#include <netinet/in.h>
#include <sys/socket.h>

#include <array>
#include <cstdlib>

#include "base/unique_fd.h"
#include "testing/waiting.h"

namespace tarnel::test {

HttpReply httpRequest(uint16_t port, std::string_view method, std::string_view target) {
  const UniqueFd socket(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const timeval limit{kDeadline.count(), 0};
  ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return {};
  const std::string request = std::string(method) + " " + std::string(target) +
                              " HTTP/1.1\r\nHost: 127.0.0.1:" + std::to_string(port) +
                              "\r\nContent-Length: 0\r\nConnection: close\r\n\r\n";
  if (::send(socket.get(), request.data(), request.size(), MSG_NOSIGNAL) < 0) return {};
  std::string answer;
  std::array<char, 16384> bytes{};
  for (ssize_t count = 0; (count = ::recv(socket.get(), bytes.data(), bytes.size(), 0)) > 0;) {
    answer.append(bytes.data(), static_cast<size_t>(count));
  }
  const size_t body = answer.find("\r\n\r\n");
  if (body == std::string::npos || answer.size() < 12) return {};
  return {std::atoi(answer.c_str() + 9), answer.substr(body + 4)};
}

}  // namespace tarnel::test
