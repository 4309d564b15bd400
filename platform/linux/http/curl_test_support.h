#pragma once

#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <semaphore>
#include <string>
#include <utility>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "base/log.h"
#include "platform/linux/http/curl_http_client.h"
#include "testing/raw_http_server.h"

namespace tarnel {

using test::httpAnswer;
using test::RawConnection;
using test::RawHttpServer;
using testing::HasSubstr;

class QuietLog final : public Log {
 public:
  std::vector<std::string> lines() const {
    const std::lock_guard lock(mutex_);
    return lines_;
  }

 protected:
  void write(LogLevel, std::string_view text) override {
    const std::lock_guard lock(mutex_);
    lines_.emplace_back(text);
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> lines_;
};

// Collects answers that arrive on the client's thread.
class Answers {
 public:
  HttpClient::Completion completion() {
    return [this](HttpResult result) {
      const std::lock_guard lock(mutex_);
      results_.push_back(std::move(result));
      changed_.notify_all();
    };
  }
  std::vector<HttpResult> waitFor(size_t count) {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [this, count] { return results_.size() >= count; });
    return results_;
  }
  size_t count() const {
    const std::lock_guard lock(mutex_);
    return results_.size();
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<HttpResult> results_;
};

inline HttpClientOptions plainOptions() {
  HttpClientOptions options;
  options.systemCertificateFiles.clear();
  return options;
}

inline HttpRequest get(std::string url) {
  HttpRequest request;
  request.url = std::move(url);
  return request;
}

inline HttpRequest post(std::string url, std::string body) {
  HttpRequest request = get(std::move(url));
  request.method = "POST";
  request.body = std::make_shared<const std::string>(std::move(body));
  return request;
}

// The answer must be an error; its description. Its status must have been known when one is given, else not.
inline std::string errorOf(const HttpResult& result, int status = 0) {
  EXPECT_FALSE(result.data);
  EXPECT_EQ(result.response ? result.response->statusCode : 0, status);
  if (!result.error) return "no error";
  EXPECT_EQ(result.error->domain(), kHttpErrorDomain);
  return result.error->localizedDescription();
}

}  // namespace tarnel
