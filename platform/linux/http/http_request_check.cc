#include "platform/linux/http/http_request_check.h"

#include <curl/curl.h>
#include <strings.h>

#include <algorithm>
#include <cctype>
#include <memory>

namespace tarnel::detail {
namespace {

using Url = std::unique_ptr<CURLU, decltype(&curl_url_cleanup)>;

// RFC 9110 section 5.6.2.
bool isToken(std::string_view text) {
  static constexpr std::string_view kMarks = "!#$%&'*+-.^_`|~";
  const auto allowed = [](char c) {
    return (c >= '0' && c <= '9') || (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') ||
           kMarks.find(c) != std::string_view::npos;
  };
  return !text.empty() && std::all_of(text.begin(), text.end(), allowed);
}

bool isHeaderValue(std::string_view text) {
  return std::none_of(text.begin(), text.end(), [](char c) {
    return (static_cast<unsigned char>(c) < 0x20 && c != '\t') || c == 0x7F;
  });
}

std::optional<std::string> part(CURLU* url, CURLUPart which, unsigned flags) {
  char* text = nullptr;
  if (curl_url_get(url, which, &text, flags) != CURLUE_OK) return std::nullopt;
  const std::unique_ptr<char, decltype(&curl_free)> owned(text, curl_free);
  std::string out(text);
  std::transform(out.begin(), out.end(), out.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return out;
}

std::optional<std::string> problemWithUrl(const std::string& text) {
  if (text.find('\0') != std::string::npos) return "the URL holds a NUL character";
  const Url url(curl_url(), curl_url_cleanup);
  if (url == nullptr) return "out of memory";
  const CURLUcode code = curl_url_set(url.get(), CURLUPART_URL, text.c_str(), CURLU_NON_SUPPORT_SCHEME);
  if (code != CURLUE_OK) return "\"" + text + "\" is no http or https URL: " + curl_url_strerror(code);
  const auto scheme = part(url.get(), CURLUPART_SCHEME, 0);
  if (scheme != "http" && scheme != "https") {
    return "\"" + text + "\": only http and https are supported, not \"" + scheme.value_or("") + '"';
  }
  return std::nullopt;
}

}  // namespace

bool equalIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

std::optional<std::string> problemWith(const HttpRequest& request) {
  if (auto problem = problemWithUrl(request.url)) return problem;
  if (!isToken(request.method)) return "\"" + headerSafe(request.method) + "\" is no HTTP method";
  const std::string length = std::to_string(request.body == nullptr ? 0 : request.body->size());
  for (const auto& [name, value] : request.headers) {
    if (!isToken(name)) return "\"" + headerSafe(name) + "\" is no header name";
    if (!isHeaderValue(value)) {
      return "the header \"" + name + "\" holds control characters; remove them with headerSafe()";
    }
    if (equalIgnoringCase(name, "Content-Length") && value != length) {
      return "the header \"Content-Length\" says " + value + ", but the body has " + length + " bytes";
    }
    if (equalIgnoringCase(name, "Transfer-Encoding")) {
      return "the header \"Transfer-Encoding\" cannot be set; bodies are sent whole";
    }
  }
  return std::nullopt;
}

std::optional<Origin> originOf(const std::string& text) {
  const Url url(curl_url(), curl_url_cleanup);
  if (url == nullptr ||
      curl_url_set(url.get(), CURLUPART_URL, text.c_str(), CURLU_NON_SUPPORT_SCHEME) != CURLUE_OK) {
    return std::nullopt;
  }
  const auto scheme = part(url.get(), CURLUPART_SCHEME, 0);
  const auto host = part(url.get(), CURLUPART_HOST, 0);
  const auto port = part(url.get(), CURLUPART_PORT, CURLU_DEFAULT_PORT);
  if ((scheme != "http" && scheme != "https") || !host || !port) return std::nullopt;
  return Origin{*scheme, *host, *port};
}

}  // namespace tarnel::detail
