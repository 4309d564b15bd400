#include "util/socket_address.h"

#include <arpa/inet.h>

#include <string>

namespace tarnel {

Ipv4Address socketAddress(std::string_view dottedText, uint16_t port) {
  constexpr size_t kMaxText = 16;
  in_addr address{};
  if (::inet_aton(std::string(dottedText.substr(0, kMaxText)).c_str(), &address) == 0) {
    address.s_addr = INADDR_NONE;
  }
  return {ntohl(address.s_addr), port};
}

}  // namespace tarnel
