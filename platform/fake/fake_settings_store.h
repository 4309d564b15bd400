#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/settings_store.h"

namespace tarnel::fake {

// In memory, one layer. Threads: any.
class FakeSettingsStore final : public SettingsStore {
 public:
  // While true nothing can be read and nothing is kept.
  std::atomic<bool> broken{false};
  // Called once, after the next reading, as if another thread came in between. Set up before threads start.
  std::function<void()> afterNextRead;

  std::optional<Value> objectForKey(std::string_view domain, std::string_view key) override {
    std::optional<Value> value;
    std::function<void()> action;
    {
      const std::lock_guard guard(mutex_);
      const auto found = values_.find({std::string(domain), std::string(key)});
      if (!broken && found != values_.end()) value = found->second;
      std::swap(action, afterNextRead);
    }
    if (action) action();
    return value;
  }
  MaybeError setObject(std::string_view domain, std::string_view key, const Value& value) override {
    if (broken) return Error("TarnelSettingsErrorDomain", 5, "the settings store is broken");
    const std::lock_guard guard(mutex_);
    values_[{std::string(domain), std::string(key)}] = value;
    return std::nullopt;
  }
  MaybeError removeObject(std::string_view domain, std::string_view key) override {
    if (broken) return Error("TarnelSettingsErrorDomain", 5, "the settings store is broken");
    const std::lock_guard guard(mutex_);
    values_.erase({std::string(domain), std::string(key)});
    return std::nullopt;
  }
  std::vector<std::string> ownKeys(std::string_view domain, std::string_view prefix) override {
    std::vector<std::string> keys;
    if (broken) return keys;
    const std::lock_guard guard(mutex_);
    for (const auto& [place, value] : values_) {
      if (place.first == domain && place.second.starts_with(prefix)) keys.push_back(place.second);
    }
    return keys;
  }

 private:
  std::mutex mutex_;
  std::map<std::pair<std::string, std::string>, Value> values_;
};

}  // namespace tarnel::fake
