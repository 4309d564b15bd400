#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/error.h"
#include "base/one_shot.h"

namespace tarnel {

struct HttpHeader {
  std::string name;
  std::string value;
};

struct HttpRequest {
  std::string method = "GET";
  std::string url;                          // http or https; anything else fails
  std::vector<HttpHeader> headers;          // sent in this order, each once
  std::shared_ptr<const std::string> body;  // absent: no body
  // From start to the last byte of the answer. Absent: the caller sets none, and the client's own limits
  // on connecting and on lack of progress end it.
  std::optional<std::chrono::milliseconds> timeout;
  // Without it the request ends well with the status and headers of the final answer, as soon as those are
  // there and the request is sent (or refused, from status 300 on), whatever becomes of the answer's body;
  // `data` is empty then. For who looks at the status alone.
  bool wantsBody = true;
};

struct HttpResponse {
  int statusCode = 0;
  std::vector<HttpHeader> headers;  // of the final answer, in order of arrival

  // Value of the first header of that name, compared ignoring case; null when there is none.
  const std::string* header(std::string_view name) const;
};

// What a completion gets: `response` and `data` (empty when the body was), or an `error` without `data`.
// Beside an error `response` is set when the final answer's headers had come before, as when its body broke
// off. A status such as 404 or 500 is an answer, no error.
struct HttpResult {
  std::optional<std::string> data;
  std::optional<HttpResponse> response;
  MaybeError error;
};

// The shared HTTP session of the process: TLS verified, http and https only, redirects followed within
// these two and never from https to http, no cache, no cookies, answers bounded in size. A request other than
// GET and HEAD reaches a server at most once, redirects apart: it is not sent again when its connection ends.
//
// Threads: any thread may call. Completions run on the client's own thread, exactly once each, also when
// the client goes away; they must not block.
class HttpClient {
 public:
  using Completion = OneShot<void(HttpResult)>;

  HttpClient() = default;
  HttpClient(const HttpClient&) = delete;
  HttpClient& operator=(const HttpClient&) = delete;
  virtual ~HttpClient() = default;

  // Starts the request at once and returns.
  virtual void startDataTask(HttpRequest request, Completion completion) = 0;
};

// The text without control characters (line ends and NUL among them): for header values that a stranger
// wrote. A request with such characters in a header fails, lest anybody add headers of their own.
std::string headerSafe(std::string_view text);

// Starts the request and holds the calling thread until it has ended. Never call it on the client's thread.
HttpResult performAndWait(HttpClient& client, HttpRequest request);

// Domain of the errors that a client reports for transport failures; a positive code is the HTTP library's
// own, a negative one means that the client itself refused or gave up.
inline constexpr char kHttpErrorDomain[] = "TarnelHTTPErrorDomain";
inline constexpr int64_t kHttpClientGoingAway = -1;
inline constexpr int64_t kHttpTooMuchQueued = -2;
inline constexpr int64_t kHttpBadRequest = -3;  // URL, method or a header that cannot be sent
inline constexpr int64_t kHttpNotBegun = -4;    // no thread or no memory for it, or no turn in time

// Whether the request was made and has ended by itself, whatever came of it: not when the client refused it,
// never began it, or gave it up because it goes away (the negative codes).
bool wasCarriedOut(const HttpResult& result);

}  // namespace tarnel
