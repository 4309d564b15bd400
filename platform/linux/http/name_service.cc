#include "platform/linux/http/name_service.h"

#include <dlfcn.h>
#include <netdb.h>

#include <algorithm>
#include <fstream>
#include <sstream>
#include <string>

namespace tarnel::detail {
namespace {

bool isModuleName(const std::string& word) {
  return !word.empty() && std::all_of(word.begin(), word.end(), [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_';
  });
}

}  // namespace

void preloadNameService() {
  addrinfo hints{};
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* found = nullptr;
  if (getaddrinfo("localhost", "443", &hints, &found) == 0) freeaddrinfo(found);

  std::ifstream switchFile("/etc/nsswitch.conf");
  for (std::string line; std::getline(switchFile, line);) {
    std::istringstream words(line.substr(0, line.find('#')));
    std::string word;
    if (!(words >> word) || word != "hosts:") continue;
    while (words >> word) {
      // Never closed: the resolver finds the module loaded under its name.
      if (isModuleName(word))
        static_cast<void>(dlopen(("libnss_" + word + ".so.2").c_str(), RTLD_NOW | RTLD_NODELETE));
    }
  }
}

}  // namespace tarnel::detail
