#include "client/src/lifetime.h"

#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <new>

#include "client/src/session_core.h"
#include "client/src/upload_file.h"

namespace tarnel::core {
namespace {

// For a callback that is running when the process ends.
constexpr std::chrono::milliseconds kGraceAtExit{1000};

struct Registry {
  std::mutex mutex;  // also held over a fork
  std::vector<std::shared_ptr<SessionCore>> sessions;
  // Sessions of a parent process: never touched, never let go.
  std::vector<std::shared_ptr<SessionCore>> inherited;
  std::vector<int> uploads;  // open descriptors
  std::atomic<uint32_t> generation{0};
};

// Never destroyed: threads and static objects may use it until the very end of the process.
Registry& registry() {
  alignas(Registry) static std::byte storage[sizeof(Registry)];
  static Registry* const made = std::construct_at(reinterpret_cast<Registry*>(storage));
  return *made;
}

void beforeFork() {
  registry().mutex.lock();
}
void afterForkInParent() {
  registry().mutex.unlock();
}

void afterForkInChild() {
  Registry& all = registry();
  for (auto& session : all.sessions) {
    session->closeDescriptorsInChild();
    all.inherited.push_back(std::move(session));
  }
  all.sessions.clear();
  for (const int descriptor : all.uploads) ::close(descriptor);
  all.uploads.clear();
  ++all.generation;
  all.mutex.unlock();
}

void watchForkAndExit() {
  [[maybe_unused]] static const bool isWatching = [] {
    pthread_atfork(beforeFork, afterForkInParent, afterForkInChild);
    return std::atexit(closeAllSessionsAtExit) == 0;
  }();
}

}  // namespace

void ForkVisibleDescriptor::change(const std::function<int()>& change) {
  const std::lock_guard lock(registry().mutex);
  fd_ = change();
}

void ForkVisibleDescriptor::closeInChild() {
  if (fd_ >= 0) ::close(fd_);
  fd_ = -1;
}

int openForUpload(const std::function<int()>& open) {
  Registry& all = registry();
  const std::lock_guard lock(all.mutex);
  if (all.uploads.size() >= kMaxUploadFiles) return kTooManyUploads;
  all.uploads.reserve(all.uploads.size() + 1);
  const int descriptor = open();
  if (descriptor >= 0) all.uploads.push_back(descriptor);
  return descriptor;
}

void closeForUpload(int descriptor) {
  Registry& all = registry();
  const std::lock_guard lock(all.mutex);
  std::erase(all.uploads, descriptor);
  ::close(descriptor);
}

void rememberSession(const std::shared_ptr<SessionCore>& session) {
  watchForkAndExit();
  const std::lock_guard lock(registry().mutex);
  registry().sessions.push_back(session);
}

void forgetSession(const SessionCore* session) {
  std::shared_ptr<SessionCore> forgotten;  // destroyed without the lock
  const std::lock_guard lock(registry().mutex);
  auto& sessions = registry().sessions;
  const auto found = std::find_if(sessions.begin(), sessions.end(),
                                  [session](const auto& held) { return held.get() == session; });
  if (found == sessions.end()) return;
  forgotten = std::move(*found);
  sessions.erase(found);
}

uint32_t forkGeneration() noexcept {
  return registry().generation.load(std::memory_order_relaxed);
}

void closeAllSessionsAtExit() {
  std::vector<std::shared_ptr<SessionCore>> sessions;
  {
    const std::lock_guard lock(registry().mutex);
    sessions = registry().sessions;
  }
  for (const auto& session : sessions) session->beginExit();
  const auto graceEnds = std::chrono::steady_clock::now() + kGraceAtExit;
  for (const auto& session : sessions) session->awaitEnd(std::max(graceEnds, session->closesBy()));
}

}  // namespace tarnel::core
