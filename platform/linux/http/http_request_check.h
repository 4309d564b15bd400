#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/http_client.h"

namespace tarnel::detail {

// Why the request cannot be sent: its URL, its method, a header or its "Content-Length"; nothing when it can.
std::optional<std::string> problemWith(const HttpRequest& request);

// Scheme, host and port of a URL, in lower case; nothing when it is no http or https URL.
struct Origin {
  std::string scheme;
  std::string host;
  std::string port;
  friend bool operator==(const Origin&, const Origin&) = default;
};
std::optional<Origin> originOf(const std::string& url);

bool equalIgnoringCase(std::string_view a, std::string_view b);

}  // namespace tarnel::detail
