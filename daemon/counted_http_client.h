#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <memory>
#include <mutex>

#include "platform/http_client.h"

namespace tarnel {

// Passes requests on and knows how many have not ended: a process with a post under way is not idle, and one
// that is told to end gives its last posts a moment.
//
// Threads: any.
class CountedHttpClient final : public HttpClient {
 public:
  // Kept by reference; must outlive this object.
  explicit CountedHttpClient(HttpClient& client) : client_(client) {}

  void startDataTask(HttpRequest request, Completion completion) override;

  size_t underWay() const;
  // Waits until no request is under way, at most that long. True when none is.
  bool waitUntilNone(std::chrono::milliseconds atMost) const;

 private:
  // Shared with the completions, which may come after this object is gone.
  struct Count {
    std::mutex mutex;
    std::condition_variable changed;
    size_t underWay = 0;  // guarded by mutex
  };
  // One request's share of the count, until it is answered or dropped.
  class Share;

  HttpClient& client_;
  const std::shared_ptr<Count> count_ = std::make_shared<Count>();
};

}  // namespace tarnel
