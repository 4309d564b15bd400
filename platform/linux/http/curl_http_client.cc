#include "platform/linux/http/curl_http_client.h"

#include <pthread.h>

#include <csignal>
#include <stdexcept>
#include <system_error>
#include <utility>

#include "platform/linux/http/curl_http_client_worker.h"
#include "platform/linux/http/http_request_check.h"
#include "platform/linux/http/name_service.h"

// What callers' threads do: requests are checked, counted and handed to the client's thread.

namespace tarnel {
namespace {

CURLM* newMulti() {
  static const CURLcode initialised = curl_global_init(CURL_GLOBAL_DEFAULT);
  CURLM* const multi = initialised == CURLE_OK ? curl_multi_init() : nullptr;
  if (multi == nullptr) throw std::runtime_error("libcurl cannot be initialised");
  return multi;
}

}  // namespace

CurlHttpClient::Worker::Worker(Log& log, HttpClientOptions options)
    : log_(log),
      options_(std::move(options)),
      multi_(newMulti()),
      context_{options_},
      queue_(options_.connectionsPerHost, options_.connections) {
  curl_multi_setopt(multi_.get(), CURLMOPT_MAXCONNECTS, static_cast<long>(options_.connections));
}

MaybeError CurlHttpClient::Worker::prepare() {
  detail::preloadNameService();
  loadCertificates();
  std::string problems;
  for (const auto& problem : certificates_.problems) problems += (problems.empty() ? "" : "; ") + problem;
  if (problems.empty()) return std::nullopt;
  return Error(kHttpErrorDomain, CURLE_SSL_CACERT_BADFILE, std::move(problems));
}

void CurlHttpClient::Worker::loadCertificates() {
  std::call_once(certificatesLoaded_, [this] {
    certificates_ = detail::loadCertificates(options_.systemCertificateFiles, options_.extraCertificateFiles,
                                             options_.extraCertificates);
    context_.certificates = certificates_.store.get();
  });
}

// Called with the lock held. An error means that the request is refused.
MaybeError CurlHttpClient::Worker::admit(const HttpRequest& request) {
  const size_t bytes = request.body == nullptr ? 0 : request.body->size();
  if (stopping_) return Error(kHttpErrorDomain, kHttpClientGoingAway, "the HTTP client is going away");
  if (bytes > options_.maxQueuedBytes || queuedBytes_ > options_.maxQueuedBytes - bytes) {
    return Error(kHttpErrorDomain, kHttpTooMuchQueued,
                 "requests of more than " + std::to_string(options_.maxQueuedBytes) + " bytes are under way");
  }
  if (queuedRequests_ >= options_.maxQueuedRequests) {
    return Error(kHttpErrorDomain, kHttpTooMuchQueued,
                 "more than " + std::to_string(options_.maxQueuedRequests) + " requests are under way");
  }
  queuedBytes_ += bytes;
  ++queuedRequests_;
  return std::nullopt;
}

// Called with the lock held. Signals are for the main thread alone.
bool CurlHttpClient::Worker::ensureThread() {
  if (thread_.joinable()) return true;
  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, &before);
  try {
    thread_ = std::thread([this] { run(); });
    pthread_setname_np(thread_.native_handle(), "tarnel-http");
  } catch (const std::system_error& error) {
    TARNEL_LOG(log_, error, "CurlHttpClient(startDataTask): cannot start the HTTP thread: %s", error.what());
  }
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  return thread_.joinable();
}

void CurlHttpClient::Worker::enqueue(HttpRequest request, Completion completion) {
  const auto now = std::chrono::steady_clock::now();
  Incoming incoming{std::move(request), std::move(completion), std::nullopt, now};
  if (auto problem = detail::problemWith(incoming.request)) {
    incoming.refusal = Error(kHttpErrorDomain, kHttpBadRequest, std::move(*problem));
  }
  incoming.deadline += incoming.request.timeout.value_or(options_.longestRequest);
  {
    const std::lock_guard lock(mutex_);
    if (!incoming.refusal) incoming.refusal = admit(incoming.request);
    if (incoming.refusal) incoming.request = HttpRequest();
    if (!closed_ && ensureThread()) {
      incoming_.push_back(std::move(incoming));
      if (incoming_.size() == 1) curl_multi_wakeup(multi_.get());
      return;
    }
    if (!incoming.refusal) {
      queuedBytes_ -= incoming.request.body == nullptr ? 0 : incoming.request.body->size();
      --queuedRequests_;
      incoming.refusal = Error(kHttpErrorDomain, kHttpNotBegun, "the HTTP thread cannot be started");
    }
  }
  complete(std::move(incoming.completion),
           HttpResult{std::nullopt, std::nullopt, std::move(incoming.refusal)});
}

void CurlHttpClient::Worker::complete(Completion completion, HttpResult result) {
  try {
    completion(std::move(result));
  } catch (const std::exception& error) {
    TARNEL_LOG(log_, error, "CurlHttpClient(complete): a completion failed: %s", error.what());
  }
}

void CurlHttpClient::Worker::stop() {
  {
    const std::lock_guard lock(mutex_);
    stopping_ = true;
    if (!thread_.joinable()) {
      closed_ = true;  // no thread is started any more
      return;
    }
  }
  curl_multi_wakeup(multi_.get());
  thread_.join();
}

CurlHttpClient::CurlHttpClient(Log& log, HttpClientOptions options)
    : worker_(std::make_unique<Worker>(log, std::move(options))) {}

CurlHttpClient::~CurlHttpClient() = default;

MaybeError CurlHttpClient::prepare() {
  return worker_->prepare();
}

void CurlHttpClient::startDataTask(HttpRequest request, Completion completion) {
  worker_->enqueue(std::move(request), std::move(completion));
}

void CurlHttpClient::stop() {
  worker_->stop();
}

}  // namespace tarnel
