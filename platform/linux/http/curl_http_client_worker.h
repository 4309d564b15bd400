#pragma once

#include <curl/curl.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/linux/http/certificate_store.h"
#include "platform/linux/http/curl_http_client.h"
#include "platform/linux/http/curl_transfer.h"
#include "platform/linux/http/due_times.h"
#include "platform/linux/http/transfer_queue.h"

namespace tarnel {

namespace detail {

struct FreeMulti {
  void operator()(CURLM* multi) const { curl_multi_cleanup(multi); }
};

}  // namespace detail

// What is behind the client. What callers' threads do stands in curl_http_client.cc, what the client's own
// thread does in curl_http_client_thread.cc.
class CurlHttpClient::Worker {
 public:
  Worker(Log& log, HttpClientOptions options);
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;
  ~Worker() { stop(); }

  MaybeError prepare();
  void enqueue(HttpRequest request, Completion completion);
  // Any number of times, by one thread at a time, which is not the client's own.
  void stop();

 private:
  // A request on its way to the client's thread; one that was refused goes the same way, for its completion.
  struct Incoming {
    HttpRequest request;
    Completion completion;
    MaybeError refusal;
    std::chrono::steady_clock::time_point deadline;
  };
  // A request that has not ended, on the wire or waiting for its turn.
  struct Active {
    std::unique_ptr<detail::CurlTransfer> transfer;
    std::chrono::milliseconds allowed;
  };

  MaybeError admit(const HttpRequest& request);
  bool ensureThread();
  void run();
  bool takeIncoming();
  void accept(Incoming incoming);
  void startWaiting();
  MaybeError start(detail::CurlTransfer& transfer);
  void endHops();
  void completeAnswered();
  void endHop(detail::CurlTransfer& transfer, CURLcode code);
  void watch(uint64_t id);
  void endStalled();
  void expire();
  int pollTime() const;
  void end(uint64_t id, HttpResult result);
  void fail(uint64_t id, Error error) { end(id, active_.at(id).transfer->failure(std::move(error))); }
  void complete(Completion completion, HttpResult result);
  void failAll();

  void loadCertificates();
  detail::CurlEasy spareHandle();

  Log& log_;
  const HttpClientOptions options_;
  std::once_flag certificatesLoaded_;
  detail::CertificateStore certificates_;
  const std::unique_ptr<CURLM, detail::FreeMulti> multi_;

  std::mutex mutex_;  // guards the six that follow
  std::vector<Incoming> incoming_;
  size_t queuedBytes_ = 0;
  size_t queuedRequests_ = 0;
  bool stopping_ = false;
  bool closed_ = false;  // nobody takes from incoming_ any more
  std::thread thread_;

  // The client's thread only.
  detail::TransferContext context_;
  detail::TransferQueue queue_;
  std::map<uint64_t, Active> active_;
  detail::DueTimes deadlines_;
  detail::DueTimes lookAt_;  // when a request on the wire may have stalled
  uint64_t lastId_ = 0;
  std::vector<detail::CurlEasy> spare_;
};

}  // namespace tarnel
