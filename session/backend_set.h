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
#include "session/separately.h"
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

// Takes the step(name, backend) with every backend of the set, each whatever another's comes to.
// operation: for the log, where one fails.
template <class Step>
void withEach(Log& log, const char* operation, const BackendSet& backends, Step step) {
  for (const auto& [name, backend] : backends) {
    separately(log, operation, name.c_str(), [&step, &name = name, &each = *backend] { step(name, each); });
  }
}

// What one backend answers to send(). A failure counts as an error that it returned.
template <class Send>
MaybeSentObject answerOf(Log& log, const char* operation, const std::string& name, Send send) {
  MaybeSentObject sent;
  if (MaybeError failure = separately(log, operation, name.c_str(), [&sent, &send] { sent = send(); })) {
    sent = *std::move(failure);
  }
  return sent;
}

void cleanUpEach(Log& log, const BackendSet& backends) noexcept;

// Backends that are cleaned up with this, unless they are released.
class TemporaryBackends {
 public:
  explicit TemporaryBackends(Log& log, BackendSet backends = {})
      : log_(log), backends_(std::move(backends)) {}
  TemporaryBackends(const TemporaryBackends&) = delete;
  TemporaryBackends& operator=(const TemporaryBackends&) = delete;
  ~TemporaryBackends() { cleanUpEach(log_, backends_); }

  const BackendSet& backends() const noexcept { return backends_; }
  void append(std::string name, std::shared_ptr<TarnelBackend> backend) {
    backends_.append(std::move(name), std::move(backend));
  }
  BackendSet release() noexcept { return std::exchange(backends_, {}); }

 private:
  Log& log_;
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
