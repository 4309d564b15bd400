#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "backends/tarnel_backend.h"
#include "util/dependencies.h"

namespace tarnel {

// Makes one backend, or none. TarnelBackend::newBackendWithName everywhere but in tests.
using BackendFactory = std::function<std::shared_ptr<TarnelBackend>(
    const Dependencies& dependencies, const std::string& name, const Value& profile,
    const MaybeString& productFamily, int32_t clientType)>;

// Backends by name, enumerated in the order in which the storebag lists them.
class BackendSet {
 public:
  using Entry = std::pair<std::string, std::shared_ptr<TarnelBackend>>;

  bool empty() const noexcept { return entries_.empty(); }
  size_t size() const noexcept { return entries_.size(); }
  auto begin() const noexcept { return entries_.begin(); }
  auto end() const noexcept { return entries_.end(); }

  // Null when the set has no backend of that name.
  TarnelBackend* find(std::string_view name) const noexcept {
    for (const auto& [key, backend] : entries_) {
      if (key == name) return backend.get();
    }
    return nullptr;
  }
  // Names are unique: a storebag's keys are.
  void append(std::string name, std::shared_ptr<TarnelBackend> backend) {
    entries_.emplace_back(std::move(name), std::move(backend));
  }

 private:
  std::vector<Entry> entries_;
};

// Backends that are cleaned up with this, each whatever another's clean-up comes to, unless they are
// released. What clean-up throws is logged under the operation's name.
class TemporaryBackends {
 public:
  // operation: lasts as long as this does.
  TemporaryBackends(Log& log, const char* operation, BackendSet backends = {})
      : log_(log), operation_(operation), backends_(std::move(backends)) {}
  TemporaryBackends(const TemporaryBackends&) = delete;
  TemporaryBackends& operator=(const TemporaryBackends&) = delete;
  ~TemporaryBackends();

  const BackendSet& backends() const noexcept { return backends_; }
  void append(std::string name, std::shared_ptr<TarnelBackend> backend) {
    backends_.append(std::move(name), std::move(backend));
  }
  BackendSet release() noexcept { return std::exchange(backends_, {}); }

 private:
  void cleanUp(const std::string& name, TarnelBackend& backend) noexcept;

  Log& log_;
  const char* const operation_;
  BackendSet backends_;
};

// createBackends
// One backend per top-level key of the storebag that the factory makes one for, set up with what the session
// info and the device say; their states are not decided yet. Keys that are no backend are passed over,
// the first 256 of them by the factory, which names them in the log; how many there are beyond is one line.
//
// deviceID: the device's unique identifier, at most 40 bytes.
// Returns nothing, logged, without a storebag or without session info. Where setting one up throws, those
// made so far are cleaned up.
std::optional<BackendSet> createBackends(const Dependencies& dependencies, const BackendFactory& factory,
                                         const MaybeDictionary& storebag, const MaybeDictionary& sessionInfo,
                                         const MaybeDictionary& userInfo, std::string_view deviceID);

}  // namespace tarnel
