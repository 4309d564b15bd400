#pragma once

#include <tarnel/tarnel.h>

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "bench/load_options.h"

namespace tarnel::bench {

// One client with its session. Threads: the calls from one; answers come on the session's own.
class LoadClient {
 public:
  LoadClient(const LoadOptions& options, size_t number);

  // Each returns why it failed, or nothing.
  std::optional<std::string> connect();
  std::optional<std::string> configure();
  // Sends `count` messages, keeping the window full, and waits for the last answer.
  std::optional<std::string> send(const std::vector<client::Dictionary>& payloads, size_t count,
                                  std::atomic<size_t>& answered);
  // Returns when the posts before it have been answered as well.
  std::optional<std::string> flush();

 private:
  client::Status sendOne(const client::Dictionary& payload, const client::Completion& completion);
  bool waitUntilOutstanding(size_t atMost);

  const LoadOptions& options_;
  const size_t number_;
  std::mutex mutex_;
  std::condition_variable changed_;
  size_t outstanding_ = 0;              // guarded by mutex_
  std::optional<std::string> failure_;  // guarded by mutex_
  client::Session session_;             // last: its thread uses what stands above
};

// A ring of payloads to send from.
std::vector<client::Dictionary> loadPayloads(Payload payload);

}  // namespace tarnel::bench
