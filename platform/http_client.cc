#include "platform/http_client.h"

#include <strings.h>

#include <algorithm>
#include <semaphore>

namespace tarnel {

const std::string* HttpResponse::header(std::string_view name) const {
  const auto matches = [name](const HttpHeader& header) {
    return header.name.size() == name.size() &&
           strncasecmp(header.name.data(), name.data(), name.size()) == 0;
  };
  const auto found = std::find_if(headers.begin(), headers.end(), matches);
  return found == headers.end() ? nullptr : &found->value;
}

std::string headerSafe(std::string_view text) {
  std::string out(text);
  std::erase_if(out, [](char c) { return static_cast<unsigned char>(c) < 0x20 || c == 0x7F; });
  return out;
}

bool wasCarriedOut(const HttpResult& result) {
  return !result.error || result.error->domain() != kHttpErrorDomain || result.error->code() >= 0;
}

HttpResult performAndWait(HttpClient& client, HttpRequest request) {
  // Shared, so that the answer still has a place when it is signalled and this call returns at once.
  struct Wait {
    HttpResult result;
    std::binary_semaphore answered{0};
  };
  // A completion that is dropped without having been called ends the wait too.
  struct Signal {
    explicit Signal(std::shared_ptr<Wait> w) : wait(std::move(w)) {}
    Signal(const Signal&) = delete;
    Signal& operator=(const Signal&) = delete;
    Signal(Signal&&) = default;
    Signal& operator=(Signal&&) = delete;
    ~Signal() {
      if (wait != nullptr) wait->answered.release();
    }
    std::shared_ptr<Wait> wait;
  };
  const auto wait = std::make_shared<Wait>();
  wait->result.error = Error(kHttpErrorDomain, kHttpClientGoingAway, "the HTTP client dropped the request");
  client.startDataTask(std::move(request), [signal = Signal(wait)](HttpResult result) {
    signal.wait->result = std::move(result);
  });
  wait->answered.acquire();
  return std::move(wait->result);
}

}  // namespace tarnel
