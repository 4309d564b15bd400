#pragma once

#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "platform/http_client.h"

namespace tarnel::fake {

// Keeps every request. Answers each at once, on the calling thread, with what `answer` gives; where
// `holdAnswers` is set, keeps the completions until the test gives the answers.
// Threads: startDataTask from any; the rest from the test.
class FakeHttpClient final : public HttpClient {
 public:
  struct Pending {
    HttpRequest request;
    Completion completion;
  };

  void startDataTask(HttpRequest request, Completion completion) override {
    std::function<HttpResult(const HttpRequest&)> answerNow;
    {
      const std::lock_guard guard(mutex_);
      requests_.push_back(request);
      if (holdAnswers_) {
        pending_.push_back({std::move(request), std::move(completion)});
        return;
      }
      answerNow = answer_;
    }
    completion(answerNow(request));
  }

  void setAnswer(std::function<HttpResult(const HttpRequest&)> answer) {
    const std::lock_guard guard(mutex_);
    answer_ = std::move(answer);
  }
  void setAnswer(HttpResult result) {
    setAnswer([result = std::move(result)](const HttpRequest&) { return result; });
  }
  void holdAnswers(bool hold) {
    const std::lock_guard guard(mutex_);
    holdAnswers_ = hold;
  }
  size_t pendingCount() const {
    const std::lock_guard guard(mutex_);
    return pending_.size();
  }
  // Answers the oldest held request.
  void answerOldest(HttpResult result) {
    Completion completion;
    {
      const std::lock_guard guard(mutex_);
      completion = std::move(pending_.front().completion);
      pending_.pop_front();
    }
    completion(std::move(result));
  }
  std::vector<HttpRequest> requests() const {
    const std::lock_guard guard(mutex_);
    return requests_;
  }
  // Forgets the requests so far; those that wait for an answer stay.
  void clear() {
    const std::lock_guard guard(mutex_);
    requests_.clear();
  }

  static HttpResult status(int code, std::string body = {}, std::vector<HttpHeader> headers = {}) {
    return {std::move(body), HttpResponse{code, std::move(headers)}, std::nullopt};
  }
  static HttpResult failure(std::string description) {
    return {std::nullopt, std::nullopt, Error(kHttpErrorDomain, 7, std::move(description))};
  }

 private:
  mutable std::mutex mutex_;
  std::vector<HttpRequest> requests_;
  std::deque<Pending> pending_;
  std::function<HttpResult(const HttpRequest&)> answer_ = [](const HttpRequest&) { return status(200); };
  bool holdAnswers_ = false;
};

}  // namespace tarnel::fake
