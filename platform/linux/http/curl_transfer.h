#pragma once

#include <curl/curl.h>
#include <openssl/x509.h>

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/http_client.h"
#include "platform/linux/http/curl_http_client.h"

namespace tarnel::detail {

struct FreeCurl {
  void operator()(CURL* easy) const { curl_easy_cleanup(easy); }
  void operator()(curl_slist* list) const { curl_slist_free_all(list); }
};
using CurlEasy = std::unique_ptr<CURL, FreeCurl>;
using CurlList = std::unique_ptr<curl_slist, FreeCurl>;

// What all transfers of one client share.
struct TransferContext {
  const HttpClientOptions& options;
  X509_STORE* certificates = nullptr;
  size_t heldAnswerBytes = 0;
  std::vector<uint64_t> answered;  // those that want no body and whose final headers have come
};

// One request on its way, redirects included. Threads: the client's own only.
class CurlTransfer {
 public:
  CurlTransfer(uint64_t id, HttpRequest request, HttpClient::Completion completion, TransferContext& context);
  CurlTransfer(const CurlTransfer&) = delete;
  CurlTransfer& operator=(const CurlTransfer&) = delete;
  ~CurlTransfer();

  uint64_t id() const { return id_; }
  // Scheme, name and port of the server that the request goes to next.
  std::string host() const;

  // Prepares a handle for the request as it stands; comes before every hop. What is returned is the problem.
  std::optional<std::string> begin(CurlEasy easy);
  CURL* handle() const { return easy_.get(); }
  // When a byte of the hop last moved in either direction; nothing while it waits for its connection.
  std::optional<std::chrono::steady_clock::time_point> lastMoved() const { return moved_; }

  // After a hop ended well by the library's account: whether its headers came whole. The library takes a
  // connection that closes between two headers for a complete answer.
  MaybeError incompleteAnswer() const;

  // After a whole answer: whether another hop is due; the request then stands as that hop
  // sends it. An error means that the redirect is refused.
  enum class Next { finished, hop };
  Result<Next> followRedirect();

  // Whether the result is certain before the answer's body has come: nobody wants it, the final headers are
  // there, and the request is sent or not wanted any more.
  bool isAnswered() const;

  // The final answer, or why there is none.
  HttpResult result(CURLcode code);
  // The error, beside what is known of the final answer.
  HttpResult failure(Error error);

  HttpClient::Completion takeCompletion() { return std::move(completion_); }
  CurlEasy takeHandle() { return std::move(easy_); }
  size_t bodyBytes() const { return bodyBytes_; }

 private:
  template <class T>
  void set(CURLoption option, T value) {
    if (setUp_ == CURLE_OK) setUp_ = curl_easy_setopt(easy_.get(), option, value);
  }
  void setMethodAndBody();
  void setHeaders();
  void addHeaderLine(const std::string& line);
  void setConnection();
  void dropAnswer();
  int status() const;
  bool hasFinalHeaders() const;
  HttpResponse takeResponse() { return {status(), std::move(headers_)}; }
  Error errorOf(CURLcode code);
  MaybeError redirectTo(const std::string& url, int status);

  size_t readBody(char* into, size_t atMost);
  size_t receiveBody(std::string_view bytes);
  size_t receiveHeader(std::string_view line);
  void noteMoved() { moved_ = std::chrono::steady_clock::now(); }
  bool refuseSecondSending();
  // Runs what the library calls. Its frames are C: nothing may be thrown through them. What is thrown, which
  // can only be for want of memory, ends the transfer by `abort`, the value by which that callback says so.
  template <class Value, class Callback>
  Value guarded(Value abort, Callback callback) noexcept {
    try {
      return callback();
    } catch (...) {
      isOutOfMemory_ = true;
      return abort;
    }
  }
  static curl_socket_t onOpenSocket(void* self, curlsocktype purpose, curl_sockaddr* address);
  static int onConnected(void* self, char* remote, char* local, int remotePort, int localPort);
  static int onProgress(void* self, curl_off_t downTotal, curl_off_t down, curl_off_t upTotal, curl_off_t up);
  static size_t onRead(char* into, size_t size, size_t count, void* self);
  static size_t onBody(char* bytes, size_t size, size_t count, void* self);
  static size_t onHeader(char* bytes, size_t size, size_t count, void* self);
  static CURLcode onTls(CURL* easy, void* context, void* certificates);

  const uint64_t id_;
  HttpRequest request_;
  HttpClient::Completion completion_;
  TransferContext& context_;
  const size_t bodyBytes_;
  CurlEasy easy_;
  CurlList headerList_;
  CURLcode setUp_ = CURLE_OK;
  std::array<char, CURL_ERROR_SIZE> errorText_{};
  size_t redirects_ = 0;
  std::optional<std::chrono::steady_clock::time_point> moved_;
  curl_off_t sent_ = 0;
  size_t bodyRead_ = 0;  // by the library, in this hop

  std::vector<HttpHeader> headers_;
  size_t headerBytes_ = 0;
  bool headersEnded_ = false;
  size_t received_ = 0;         // of the body
  std::string data_;            // empty when it is not wanted
  MaybeError refusal_;          // why a callback ended the transfer
  bool isOutOfMemory_ = false;  // that a callback ended it for that
};

}  // namespace tarnel::detail
