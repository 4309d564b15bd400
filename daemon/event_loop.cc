#include "daemon/event_loop.h"

#include <signal.h>
#include <sys/eventfd.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>
#include <utility>

namespace tarnel {
namespace {

void check(int result, const char* what) {
  if (result < 0) throw std::system_error(-result, std::generic_category(), what);
}

sigset_t endingSignals() {
  sigset_t signals{};
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  return signals;
}

uint64_t monotonicMicroseconds() {
  timespec now{};
  ::clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<uint64_t>(now.tv_sec) * 1000000U + static_cast<uint64_t>(now.tv_nsec) / 1000U;
}

}  // namespace

EventLoop::EventLoop() {
  const sigset_t ending = endingSignals();
  check(-::pthread_sigmask(SIG_BLOCK, &ending, nullptr), "block signals");

  sd_event* event = nullptr;
  check(sd_event_new(&event), "event loop");
  event_.reset(event);
  // Without a handler the loop ends with status 0.
  check(sd_event_add_signal(event, nullptr, SIGTERM, nullptr, nullptr), "watch SIGTERM");
  check(sd_event_add_signal(event, nullptr, SIGINT, nullptr, nullptr), "watch SIGINT");

  wake_ = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (wake_ < 0) throw std::system_error(errno, std::generic_category(), "eventfd");
  sd_event_source* woken = nullptr;
  const auto onWoken = [](sd_event_source*, int descriptor, uint32_t, void* self) {
    uint64_t count = 0;
    if (::read(descriptor, &count, sizeof count) > 0) static_cast<EventLoop*>(self)->takeRequest();
    return 0;
  };
  const int watched = sd_event_add_io(event, &woken, wake_, EPOLLIN, onWoken, this);
  woken_.reset(woken);
  if (watched < 0) ::close(wake_);
  check(watched, "watch eventfd");
}

EventLoop::~EventLoop() {
  timer_.reset();
  woken_.reset();
  ::close(wake_);
}

void EventLoop::armTimer(std::chrono::seconds delay, uint64_t generation) {
  const uint64_t at = monotonicMicroseconds() + static_cast<uint64_t>(delay.count()) * 1000000U;
  {
    const std::lock_guard guard(mutex_);
    request_ = Request{at, generation};
  }
  const uint64_t one = 1;
  // A counter that is full wakes the loop as well.
  [[maybe_unused]] const ssize_t written = ::write(wake_, &one, sizeof one);
}

void EventLoop::takeRequest() {
  std::optional<Request> request;
  {
    const std::lock_guard guard(mutex_);
    request.swap(request_);
  }
  if (!request) return;
  generation_ = request->generation;
  const auto onTime = [](sd_event_source*, uint64_t, void* self) {
    auto* loop = static_cast<EventLoop*>(self);
    if (loop->elapsed_) loop->elapsed_(loop->generation_);
    return 0;
  };
  sd_event_source* timer = nullptr;
  constexpr uint64_t kAccuracy = 100000;  // a tenth of a second: idle processes are woken together
  if (sd_event_add_time(event_.get(), &timer, CLOCK_MONOTONIC, request->at, kAccuracy, onTime, this) >= 0) {
    timer_.reset(timer);
  }
}

void EventLoop::exit(int status) {
  sd_event_exit(event_.get(), status);
}

int EventLoop::run() {
  const int status = sd_event_loop(event_.get());
  const sigset_t ending = endingSignals();
  ::pthread_sigmask(SIG_UNBLOCK, &ending, nullptr);
  return status < 0 ? 1 : status;
}

}  // namespace tarnel
