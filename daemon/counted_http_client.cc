#include "daemon/counted_http_client.h"

#include <utility>

namespace tarnel {

class CountedHttpClient::Share {
 public:
  explicit Share(std::shared_ptr<Count> count) : count_(std::move(count)) {
    const std::lock_guard guard(count_->mutex);
    ++count_->underWay;
  }
  Share(Share&&) noexcept = default;
  Share& operator=(Share&&) = delete;
  ~Share() {
    if (count_ == nullptr) return;
    const std::lock_guard guard(count_->mutex);
    if (--count_->underWay == 0) count_->changed.notify_all();
  }

 private:
  std::shared_ptr<Count> count_;
};

void CountedHttpClient::startDataTask(HttpRequest request, Completion completion) {
  client_.startDataTask(std::move(request),
                        [share = Share(count_), completion = std::move(completion)](
                            HttpResult result) mutable { completion(std::move(result)); });
}

size_t CountedHttpClient::underWay() const {
  const std::lock_guard guard(count_->mutex);
  return count_->underWay;
}

bool CountedHttpClient::waitUntilNone(std::chrono::milliseconds atMost) const {
  std::unique_lock guard(count_->mutex);
  return count_->changed.wait_for(guard, atMost, [this] { return count_->underWay == 0; });
}

}  // namespace tarnel
