#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace tarnel::test {

struct HttpReply {
  int status = 0;  // 0: there was none
  std::string body;
};

// One request to a server on this machine that speaks plain HTTP, waited for.
HttpReply httpRequest(uint16_t port, std::string_view method, std::string_view target);

}  // namespace tarnel::test
