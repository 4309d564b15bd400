#include "platform/linux/curl_http_client.h"

#include <curl/curl.h>
#include <pthread.h>

#include <algorithm>
#include <csignal>
#include <map>
#include <mutex>
#include <stdexcept>
#include <system_error>
#include <thread>
#include <utility>

#include "platform/linux/certificate_store.h"
#include "platform/linux/curl_transfer.h"
#include "platform/linux/due_times.h"
#include "platform/linux/http_request_check.h"
#include "platform/linux/name_service.h"
#include "platform/linux/transfer_queue.h"

namespace tarnel {
namespace {

using detail::CurlEasy;
using detail::CurlTransfer;
using SteadyTime = std::chrono::steady_clock::time_point;

constexpr size_t kSpareHandles = 16;

struct FreeMulti {
  void operator()(CURLM* multi) const { curl_multi_cleanup(multi); }
};

CURLM* newMulti() {
  static const CURLcode initialised = curl_global_init(CURL_GLOBAL_DEFAULT);
  CURLM* const multi = initialised == CURLE_OK ? curl_multi_init() : nullptr;
  if (multi == nullptr) throw std::runtime_error("libcurl cannot be initialised");
  return multi;
}

}  // namespace

class CurlHttpClient::Worker {
 public:
  Worker(Log& log, HttpClientOptions options)
      : log_(log),
        options_(std::move(options)),
        multi_(newMulti()),
        context_{options_},
        queue_(options_.connectionsPerHost, options_.connections) {
    curl_multi_setopt(multi_.get(), CURLMOPT_MAXCONNECTS, static_cast<long>(options_.connections));
  }
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;
  ~Worker() { stop(); }

  MaybeError prepare() {
    detail::preloadNameService();
    loadCertificates();
    std::string problems;
    for (const auto& problem : certificates_.problems) problems += (problems.empty() ? "" : "; ") + problem;
    if (problems.empty()) return std::nullopt;
    return Error(kHttpErrorDomain, CURLE_SSL_CACERT_BADFILE, std::move(problems));
  }

  void enqueue(HttpRequest request, Completion completion);

 private:
  // A request on its way to the client's thread; one that was refused goes the same way, for its completion.
  struct Incoming {
    HttpRequest request;
    Completion completion;
    MaybeError refusal;
    SteadyTime deadline;
  };
  // A request that has not ended, on the wire or waiting for its turn.
  struct Active {
    std::unique_ptr<CurlTransfer> transfer;
    std::chrono::milliseconds allowed;
  };

  MaybeError admit(const HttpRequest& request);
  bool ensureThread();
  void run();
  bool takeIncoming();
  void accept(Incoming incoming);
  void startWaiting();
  MaybeError start(CurlTransfer& transfer);
  void endHops();
  void endHop(CurlTransfer& transfer, CURLcode code);
  void watch(uint64_t id);
  void endStalled();
  void expire();
  int pollTime() const;
  void end(uint64_t id, HttpResult result);
  void fail(uint64_t id, Error error) { end(id, HttpResult{std::nullopt, std::nullopt, std::move(error)}); }
  void complete(Completion completion, HttpResult result);
  void stop();
  void failAll();

  void loadCertificates() {
    std::call_once(certificatesLoaded_, [this] {
      certificates_ = detail::loadCertificates(options_.systemCertificateFiles,
                                               options_.extraCertificateFiles, options_.extraCertificates);
      context_.certificates = certificates_.store.get();
    });
  }
  CurlEasy spareHandle() {
    if (spare_.empty()) return CurlEasy(curl_easy_init());
    CurlEasy easy = std::move(spare_.back());
    spare_.pop_back();
    return easy;
  }

  Log& log_;
  const HttpClientOptions options_;
  std::once_flag certificatesLoaded_;
  detail::CertificateStore certificates_;
  const std::unique_ptr<CURLM, FreeMulti> multi_;

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
  std::vector<CurlEasy> spare_;
};

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
      incoming.refusal = Error(kHttpErrorDomain, CURLE_FAILED_INIT, "the HTTP thread cannot be started");
    }
  }
  complete(std::move(incoming.completion),
           HttpResult{std::nullopt, std::nullopt, std::move(incoming.refusal)});
}

void CurlHttpClient::Worker::run() {
  loadCertificates();
  while (takeIncoming()) {
    startWaiting();
    int running = 0;
    curl_multi_perform(multi_.get(), &running);
    endHops();
    endStalled();
    expire();
    startWaiting();
    curl_multi_poll(multi_.get(), nullptr, 0, pollTime(), nullptr);
  }
  failAll();
}

// False when the client is going away.
bool CurlHttpClient::Worker::takeIncoming() {
  std::vector<Incoming> taken;
  {
    const std::lock_guard lock(mutex_);
    if (stopping_) return false;
    taken.swap(incoming_);
  }
  for (auto& incoming : taken) accept(std::move(incoming));
  return true;
}

void CurlHttpClient::Worker::accept(Incoming incoming) {
  if (incoming.refusal) {
    complete(std::move(incoming.completion),
             HttpResult{std::nullopt, std::nullopt, std::move(incoming.refusal)});
    return;
  }
  const auto allowed = incoming.request.timeout.value_or(options_.longestRequest);
  const uint64_t id = ++lastId_;
  auto transfer = std::make_unique<CurlTransfer>(id, std::move(incoming.request),
                                                 std::move(incoming.completion), context_);
  queue_.add(id, transfer->host());
  deadlines_.set(id, incoming.deadline);
  active_.emplace(id, Active{std::move(transfer), allowed});
}

void CurlHttpClient::Worker::startWaiting() {
  while (const auto id = queue_.next()) {
    if (auto failure = start(*active_.at(*id).transfer)) {
      fail(*id, std::move(*failure));
    } else {
      watch(*id);
    }
  }
}

MaybeError CurlHttpClient::Worker::start(CurlTransfer& transfer) {
  if (auto failure = transfer.begin(transfer.handle() == nullptr ? spareHandle() : transfer.takeHandle()))
    return failure;
  const CURLMcode code = curl_multi_add_handle(multi_.get(), transfer.handle());
  if (code == CURLM_OK) return std::nullopt;
  return Error(kHttpErrorDomain, CURLE_FAILED_INIT, curl_multi_strerror(code));
}

void CurlHttpClient::Worker::endHops() {
  int left = 0;
  while (const CURLMsg* message = curl_multi_info_read(multi_.get(), &left)) {
    if (message->msg != CURLMSG_DONE) continue;
    const CURLcode code = message->data.result;  // the message is gone once its handle is removed
    CURL* const easy = message->easy_handle;
    CurlTransfer* transfer = nullptr;
    curl_easy_getinfo(easy, CURLINFO_PRIVATE, &transfer);
    curl_multi_remove_handle(multi_.get(), easy);
    endHop(*transfer, code);
  }
}

void CurlHttpClient::Worker::endHop(CurlTransfer& transfer, CURLcode code) {
  const uint64_t id = transfer.id();
  if (code != CURLE_OK) return end(id, transfer.result(code));
  if (auto incomplete = transfer.incompleteAnswer()) return fail(id, std::move(*incomplete));
  const auto next = transfer.followRedirect();
  if (!next) return fail(id, next.error());
  if (*next == CurlTransfer::Next::finished) return end(id, transfer.result(code));
  lookAt_.remove(id);
  queue_.remove(id);
  queue_.add(id, transfer.host());
}

// Sets when the request is looked at next: when it will have stalled unless a byte moves before, and
// meanwhile often enough to see it begin.
void CurlHttpClient::Worker::watch(uint64_t id) {
  constexpr std::chrono::milliseconds kWhileConnecting{1000};
  const auto moved = active_.at(id).transfer->lastMoved();
  lookAt_.set(id, moved ? *moved + options_.noProgress
                        : std::chrono::steady_clock::now() + std::min(kWhileConnecting, options_.noProgress));
}

// The library's own limit goes by the average of some seconds, and so comes that much later.
void CurlHttpClient::Worker::endStalled() {
  const auto now = std::chrono::steady_clock::now();
  while (const auto id = lookAt_.due(now)) {
    const auto moved = active_.at(*id).transfer->lastMoved();
    if (!moved || *moved + options_.noProgress > now) {
      watch(*id);
    } else {
      fail(*id, Error(kHttpErrorDomain, CURLE_OPERATION_TIMEDOUT,
                      "no byte was sent or received for " + std::to_string(options_.noProgress.count()) +
                          " milliseconds"));
    }
  }
}

// Time-outs count from the start of a request, so that waiting for its turn is part of them.
void CurlHttpClient::Worker::expire() {
  const auto now = std::chrono::steady_clock::now();
  while (const auto id = deadlines_.due(now)) {
    const auto allowed = active_.at(*id).allowed;
    fail(*id, Error(kHttpErrorDomain, CURLE_OPERATION_TIMEDOUT,
                    "the request timed out after " + std::to_string(allowed.count()) + " milliseconds"));
  }
}

int CurlHttpClient::Worker::pollTime() const {
  constexpr auto kLongest = std::chrono::milliseconds(std::chrono::hours(1));
  // What is on the wire has a deadline, too.
  const auto deadline = deadlines_.next();
  if (!deadline) return static_cast<int>(kLongest.count());
  const auto next = std::min(*deadline, lookAt_.next().value_or(*deadline));
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(next - std::chrono::steady_clock::now());
  return static_cast<int>(std::clamp(left, std::chrono::milliseconds(0), kLongest).count());
}

void CurlHttpClient::Worker::end(uint64_t id, HttpResult result) {
  const auto found = active_.find(id);
  const std::unique_ptr<CurlTransfer> transfer = std::move(found->second.transfer);
  deadlines_.remove(id);
  lookAt_.remove(id);
  active_.erase(found);
  queue_.remove(id);
  if (CurlEasy easy = transfer->takeHandle()) {
    curl_multi_remove_handle(multi_.get(), easy.get());  // does nothing for one that is not there
    curl_easy_reset(easy.get());
    if (spare_.size() < kSpareHandles) spare_.push_back(std::move(easy));
  }
  {
    const std::lock_guard lock(mutex_);
    queuedBytes_ -= transfer->bodyBytes();
    --queuedRequests_;
  }
  complete(transfer->takeCompletion(), std::move(result));
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
    if (!thread_.joinable()) return;
  }
  curl_multi_wakeup(multi_.get());
  thread_.join();
}

// Completions may start requests while this goes on; those are refused and completed here too.
void CurlHttpClient::Worker::failAll() {
  const Error goingAway(kHttpErrorDomain, kHttpClientGoingAway, "the HTTP client is going away");
  while (!active_.empty()) fail(active_.begin()->first, goingAway);
  while (true) {
    std::vector<Incoming> taken;
    {
      const std::lock_guard lock(mutex_);
      taken.swap(incoming_);
      closed_ = taken.empty();
    }
    if (taken.empty()) break;
    for (auto& incoming : taken) {
      complete(std::move(incoming.completion), HttpResult{std::nullopt, std::nullopt, goingAway});
    }
  }
  spare_.clear();
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

}  // namespace tarnel
