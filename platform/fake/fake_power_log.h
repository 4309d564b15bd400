#pragma once

#include <mutex>
#include <string>
#include <vector>

#include "platform/power_log.h"

namespace tarnel::fake {

// Keeps every event. Threads: any.
class FakePowerLog final : public PowerLog {
 public:
  struct Event {
    int32_t client;
    std::string eventName;
    Dictionary dictionary;
    MaybeDictionary extra;
  };

  void logRegisteredEvent(int32_t client, const std::string& eventName, const Dictionary& dictionary,
                          const MaybeDictionary& extra) override {
    const std::lock_guard guard(mutex_);
    events_.push_back({client, eventName, dictionary, extra});
  }
  std::vector<Event> events() const {
    const std::lock_guard guard(mutex_);
    return events_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<Event> events_;
};

}  // namespace tarnel::fake
