#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "base/log.h"
#include "platform/http_client.h"

namespace tarnel {

struct HttpClientOptions {
  // Whom TLS trusts: the first of these files that exists (the system's bundle), and all that follow.
  std::vector<std::string> systemCertificateFiles = {"/etc/ssl/certs/ca-certificates.crt",
                                                     "/etc/pki/tls/certs/ca-bundle.crt",
                                                     "/etc/ssl/ca-bundle.pem", "/etc/ssl/cert.pem"};
  std::vector<std::string> extraCertificateFiles;  // PEM
  std::vector<std::string> extraCertificates;      // PEM texts

  std::chrono::milliseconds connectTimeout{30000};  // name, connection and TLS handshake
  std::chrono::milliseconds noProgress{60000};      // without a byte in either direction, once connected
  std::chrono::milliseconds longestRequest{
      std::chrono::hours(1)};  // of a request without a time-out of its own

  // Longest a connection may have been idle to be used again. Common servers close theirs after 5 seconds;
  // who sends into that loses the request. The library cuts off what is left of a second, so this is
  // almost 4.
  std::chrono::seconds idleConnection{3};

  size_t maxAnswerBytes = 8U << 20U;       // of one body; a larger one is an error
  size_t maxHeaderBytes = 256U << 10U;     // of all headers of one answer
  size_t maxHeldAnswerBytes = 64U << 20U;  // of all bodies that are arriving
  size_t maxQueuedBytes = 64U << 20U;      // of all request bodies that have not ended
  size_t maxQueuedRequests = 4096;         // that have not ended
  size_t connectionsPerHost = 6;           // requests on the wire, and so connections, to one host
  size_t connections = 32;                 // and to all hosts
  size_t maxRedirects = 10;

  // How much of a body that nobody wants is read, and for how long, to keep its connection.
  size_t maxUnwantedBytes = 64U << 10U;
  std::chrono::milliseconds unwantedBody{1000};
};

// The process's HTTP client: one thread, which starts with the first request, carries all transfers.
//
// Past connectionsPerHost or connections, requests wait for their turn in the order of their start; waiting
// counts toward their time-out. Past maxQueuedBytes or maxQueuedRequests a request ends at once with
// kHttpTooMuchQueued. A redirect (301, 302, 303, 307, 308) is followed by this class. Method and body stay, a
// POST's after 301 and 302 too: what was posted must arrive. Only 303, by which the server has taken the
// request, goes on as GET without the body and its "Content-" headers. "Authorization" and "Cookie" stay
// behind when scheme, host or port change. Answers come as they were sent (nothing is decompressed). No proxy
// is used, whatever the environment says.
//
// A kept connection is looked at before it is used, and not used again when it has ended. When it ends later,
// without a byte of an answer, GET and HEAD are sent again on a new one. Of anything else nobody can tell
// whether the server took it: it fails, unless no byte of its body was handed to the HTTP library.
//
// Threads: any thread may call; the object must not be destroyed by a completion. A completion that throws is
// logged and otherwise ignored.
class CurlHttpClient final : public HttpClient {
 public:
  // The log must outlive the client.
  explicit CurlHttpClient(Log& log, HttpClientOptions options = {});
  // Requests that have not ended complete with kHttpClientGoingAway before this returns.
  ~CurlHttpClient() override;

  // Loads certificates and the name service, which would otherwise be loaded with the first request: to be
  // called before the process is confined and before the first request. The error names what could not be
  // loaded, and the remedy; the client works with the rest.
  MaybeError prepare();

  void startDataTask(HttpRequest request, Completion completion) override;

  // Ends the client's thread: what has not ended completes with kHttpClientGoingAway before this returns, and
  // what is started later does at once. For an owner whose completions use what is destroyed before the
  // client. One thread at a time, and no completion, may call it; calling it again does
  // nothing.
  void stop();

 private:
  class Worker;
  std::unique_ptr<Worker> worker_;
};

}  // namespace tarnel
