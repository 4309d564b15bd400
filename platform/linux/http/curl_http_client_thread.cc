#include <algorithm>
#include <utility>

#include "platform/linux/http/curl_http_client_worker.h"

// What the client's own thread does: it carries the requests that it was handed, and completes them.

namespace tarnel {
namespace {

using detail::CurlEasy;
using detail::CurlTransfer;

constexpr size_t kSpareHandles = 16;

}  // namespace

void CurlHttpClient::Worker::run() {
  loadCertificates();
  while (takeIncoming()) {
    startWaiting();
    int running = 0;
    curl_multi_perform(multi_.get(), &running);
    endHops();
    completeAnswered();
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

CurlEasy CurlHttpClient::Worker::spareHandle() {
  if (spare_.empty()) return CurlEasy(curl_easy_init());
  CurlEasy easy = std::move(spare_.back());
  spare_.pop_back();
  return easy;
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
  const bool isFirstHop = transfer.handle() == nullptr;
  auto problem = transfer.begin(isFirstHop ? spareHandle() : transfer.takeHandle());
  if (!problem) {
    const CURLMcode code = curl_multi_add_handle(multi_.get(), transfer.handle());
    if (code == CURLM_OK) return std::nullopt;
    problem = curl_multi_strerror(code);
  }
  return Error(kHttpErrorDomain, isFirstHop ? kHttpNotBegun : int64_t{CURLE_FAILED_INIT},
               "cannot set the request up: " + *problem);
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

// Who wants no body has the result as soon as it is certain. What follows is still read, within small bounds,
// so that the connection can be used again; that holds the request's turn and its share of what may be
// queued.
void CurlHttpClient::Worker::completeAnswered() {
  std::erase_if(context_.answered, [this](uint64_t id) {
    const auto found = active_.find(id);
    if (found == active_.end()) return true;
    CurlTransfer& transfer = *found->second.transfer;
    if (!transfer.isAnswered()) return false;  // not all is sent
    complete(transfer.takeCompletion(), transfer.result(CURLE_OK));
    lookAt_.remove(id);
    deadlines_.set(id, std::chrono::steady_clock::now() + options_.unwantedBody);
    return true;
  });
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
    const auto& [transfer, allowed] = active_.at(*id);
    const bool isBegun = transfer->handle() != nullptr;  // its turn has come
    fail(*id, Error(kHttpErrorDomain, isBegun ? int64_t{CURLE_OPERATION_TIMEDOUT} : kHttpNotBegun,
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
    // One that failed goes: there are releases of the library that remember a body which could not be sent
    // again beyond the reset.
    if (!result.error && spare_.size() < kSpareHandles) spare_.push_back(std::move(easy));
  }
  {
    const std::lock_guard lock(mutex_);
    queuedBytes_ -= transfer->bodyBytes();
    --queuedRequests_;
  }
  complete(transfer->takeCompletion(), std::move(result));
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

}  // namespace tarnel
