#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

// A request and its answer, free of the library that reads and writes them.

namespace tarnel::lab {

using NameValues = std::vector<std::pair<std::string, std::string>>;

// The first value under the name; names of header fields are compared ignoring case. Null when absent.
const std::string* findHeader(const NameValues& headers, std::string_view name);
const std::string* findParameter(const NameValues& query, std::string_view name);

enum class BodyState { complete, tooLarge, cutOff };

struct HttpRequest {
  std::string method;  // GET, HEAD or POST
  std::string path;    // decoded, without the query
  NameValues query;
  std::string rawQuery;  // as it came, without the question mark
  NameValues headers;    // in alphabetical order, as they came
  std::string sender;    // "127.0.0.1:50312"
  std::string body;      // as it came, not unpacked
  BodyState bodyState = BodyState::complete;
};

struct HttpAnswer {
  int status = 200;
  NameValues headers;
  std::string contentType = "application/json";
  std::string body;

  // For tests of the clients. The wait ends early when the client goes or the server stops.
  std::chrono::milliseconds delay{0};
  // After so many bytes of the answer (its head counts) the connection is reset.
  std::optional<uint64_t> resetAfter;
  // After the body come blanks until the client goes.
  bool endless = false;
};

class HttpHandler {
 public:
  HttpHandler() = default;
  HttpHandler(const HttpHandler&) = delete;
  HttpHandler& operator=(const HttpHandler&) = delete;
  virtual ~HttpHandler() = default;

  // The largest body that a POST may have; its body is not there yet.
  virtual size_t maxBodyBytes(const HttpRequest& request) const = 0;
  // Called on many threads at once.
  virtual HttpAnswer answer(const HttpRequest& request) = 0;
  // A connection that never came to a request; text says why, with the remedy where one is known.
  virtual void connectionFailed(const std::string& sender, const std::string& text) = 0;
};

}  // namespace tarnel::lab
