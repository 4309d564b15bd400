#include "ipc/server/connection_registry.h"

#include <poll.h>
#include <sys/eventfd.h>

#include <cerrno>
#include <chrono>
#include <system_error>
#include <utility>

namespace tarnel {

ConnectionRegistry::ConnectionRegistry(const IpcLimits& limits, std::function<void()> trimHeap,
                                       CreateThread createThread)
    : limits_(limits),
      createThread_(std::move(createThread)),
      finishedEvent_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
      largeCalls_(limits.largeBytesAtWork,
                  {.trim = std::move(trimHeap), .owed = [this] { eventfd_write(finishedEvent_.get(), 1); }}) {
  if (!finishedEvent_) throw std::system_error(errno, std::generic_category(), "eventfd");
}

std::variant<ConnectionRegistry::Place, ConnectionRegistry::Full> ConnectionRegistry::enter(uint32_t uid) {
  const std::lock_guard lock(mutex_);
  if (connections_ >= limits_.connections) return Full::total;
  const auto held = connectionsOfUser_.find(uid);
  if (held != connectionsOfUser_.end() && held->second >= limits_.connectionsPerUser) return Full::perUser;
  ++connectionsOfUser_[uid];
  ++connections_;
  return Place(shared_from_this(), uid);
}

void ConnectionRegistry::leave(uint32_t uid) {
  const std::lock_guard lock(mutex_);
  --connections_;
  const auto held = connectionsOfUser_.find(uid);
  if (--held->second == 0) connectionsOfUser_.erase(held);
}

size_t ConnectionRegistry::connections() const {
  const std::lock_guard lock(mutex_);
  return connections_;
}

int ConnectionRegistry::start(std::shared_ptr<ConnectionLink> link, std::function<void()> body) {
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setstacksize(&attributes, kConnectionStackBytes);
  int error = ECANCELED;
  {
    // The new thread reports its end under the same lock, so not before all of this is done. It is listed
    // first: nothing may fail once it runs.
    const std::lock_guard lock(mutex_);
    if (!stopping_) {
      auto start = std::make_unique<Start>(Start{shared_from_this(), ++lastId_, std::move(body)});
      const auto thread = running_.emplace(start->id, Thread{std::move(link)}).first;
      error = createThread_(&thread->second.handle, &attributes, runThread, start.get());
      if (error == 0) {
        static_cast<void>(start.release());  // the thread's own now
      } else {
        running_.erase(thread);
      }
    }
  }
  pthread_attr_destroy(&attributes);
  return error;
}

void* ConnectionRegistry::runThread(void* start) {
  const std::unique_ptr<Start> own(static_cast<Start*>(start));
  pthread_setname_np(pthread_self(), "ipc-connection");
  own->body();
  own->body = nullptr;  // let go of the connection before anybody is told that it is over
  own->registry->finished(own->id);
  return nullptr;
}

void ConnectionRegistry::finished(uint64_t id) {
  const std::lock_guard lock(mutex_);
  const auto thread = running_.find(id);
  if (!leftBehind_) over_.push_back(thread->second.handle);
  running_.erase(thread);
  eventfd_write(finishedEvent_.get(), 1);
}

size_t ConnectionRegistry::threads() const {
  const std::lock_guard lock(mutex_);
  return running_.size() + over_.size();
}

void ConnectionRegistry::reap() {
  std::vector<pthread_t> over;
  {
    const std::lock_guard lock(mutex_);
    over = std::exchange(over_, {});
    eventfd_t count = 0;
    eventfd_read(finishedEvent_.get(), &count);
  }
  for (const auto thread : over) pthread_join(thread, nullptr);
}

size_t ConnectionRegistry::stopAll() {
  using Clock = std::chrono::steady_clock;
  // First, so that nobody is in line when the connections are told.
  largeCalls_.stop();
  {
    const std::lock_guard lock(mutex_);
    stopping_ = true;
    for (const auto& [id, thread] : running_) thread.link->stop("the daemon ends");
  }
  const auto end = Clock::now() + limits_.ending;
  for (reap(); threads() > 0; reap()) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - Clock::now()).count();
    if (left <= 0) break;
    pollfd finished{finishedEvent_.get(), POLLIN, 0};
    poll(&finished, 1, static_cast<int>(left));
  }
  const std::lock_guard lock(mutex_);
  leftBehind_ = true;
  for (const auto& [id, thread] : running_) pthread_detach(thread.handle);
  for (const auto thread : std::exchange(over_, {})) pthread_join(thread, nullptr);
  return running_.size();
}

}  // namespace tarnel
