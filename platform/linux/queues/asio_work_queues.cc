#include "platform/linux/queues/asio_work_queues.h"

#include <signal.h>

#define ASIO_STANDALONE
#if defined(__SANITIZE_THREAD__)
// The sanitizer knows no fences. Without them the context's mutex still orders all that it runs.
#define ASIO_DISABLE_FENCED_BLOCK
#endif
#include <algorithm>
#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>
#include <atomic>
#include <chrono>
#include <exception>
#include <system_error>
#include <thread>
#include <utility>

namespace tarnel {

struct AsioWorkQueues::Executor {
  explicit Executor(Log& l) : log(l), work(context.get_executor()) {
    // The first of each takes the context's descriptors: failing here, they do not fail later.
    const asio::steady_timer timer(context);
    const asio::posix::stream_descriptor descriptor(context);
    // Signals are for the main thread.
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before);
    try {
      thread = std::thread([this] { context.run(); });
    } catch (...) {
      pthread_sigmask(SIG_SETMASK, &before, nullptr);
      throw;
    }
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
  }
  Executor(const Executor&) = delete;
  Executor& operator=(const Executor&) = delete;
  // What still waits goes with the context, unrun; what goes then must not ask for more.
  ~Executor() {
    isEnding.store(true);
    context.stop();
    thread.join();
  }

  template <class Callable>
  void guarded(const std::string& label, Callable& callable) {
    try {
      callable();
    } catch (const std::exception& failure) {
      TARNEL_LOG(log, error, "%s: a task failed: %s", label.c_str(), failure.what());
    }
  }

  Log& log;
  std::atomic<bool> isEnding{false};
  std::atomic<size_t> sources{0};
  asio::io_context context{1};
  asio::executor_work_guard<asio::io_context::executor_type> work;
  std::thread thread;
};

namespace {

using Executor = AsioWorkQueues::Executor;
using SteadyTime = std::chrono::steady_clock::time_point;

// What a started source holds. It travels from one wait to the next and is kept by nothing else, so that
// the end of the context ends everything that waits.
class Handlers {
 public:
  Handlers(Executor& executor, std::function<void()> event, Task cancel)
      : executor_(executor), event_(std::move(event)), cancel_(std::move(cancel)) {
    executor_.sources.fetch_add(1);
  }
  Handlers(const Handlers&) = delete;
  Handlers& operator=(const Handlers&) = delete;
  ~Handlers() {
    event_ = nullptr;
    cancel_ = nullptr;
    executor_.sources.fetch_sub(1);
  }

  void event(const std::string& label) { executor_.guarded(label, event_); }
  void cancel(const std::string& label) { executor_.guarded(label, cancel_); }

 private:
  Executor& executor_;
  std::function<void()> event_;
  Task cancel_;
};

// A source as the thread sees it. Made and marked on any thread; everything else happens on the executor's.
class SourceState : public std::enable_shared_from_this<SourceState> {
 public:
  SourceState(Executor& executor, std::string label) : executor_(executor), label_(std::move(label)) {}
  SourceState(const SourceState&) = delete;
  SourceState& operator=(const SourceState&) = delete;
  virtual ~SourceState() = default;

  Executor& executor() const noexcept { return executor_; }
  // No event is handled after this when it is called on the queue, not even one that has happened already;
  // from another thread one more may be. True the first time.
  bool markCancelled() { return !isCancelled_.exchange(true); }
  void begin(std::unique_ptr<Handlers> handlers) {
    if (isCancelled_.load()) return finish(*handlers);
    wait(std::move(handlers));
  }

  virtual void stopWaiting() = 0;

 protected:
  // Waits for the next event, then calls happened().
  virtual void wait(std::unique_ptr<Handlers> handlers) = 0;
  // Lets go of what the source waits on, before the cancel handler.
  virtual void letGo() = 0;

  void happened(const std::error_code& error, std::unique_ptr<Handlers> handlers) {
    if (isCancelled_.load() || error) return finish(*handlers);
    handlers->event(label_);
    begin(std::move(handlers));
  }

 private:
  void finish(Handlers& handlers) {
    isCancelled_.store(true);
    letGo();
    handlers.cancel(label_);
  }

  Executor& executor_;
  const std::string label_;
  std::atomic<bool> isCancelled_{false};
};

class TimerState final : public SourceState {
 public:
  TimerState(Executor& executor, std::string label, std::chrono::nanoseconds period,
             std::chrono::nanoseconds leeway)
      : SourceState(executor, std::move(label)),
        timer_(executor.context),
        period_(period),
        leeway_(std::min(leeway, period / 2)) {}

  void setFirst(SteadyTime now) { due_ = now + period_; }
  void stopWaiting() override { timer_.cancel(); }

 private:
  void wait(std::unique_ptr<Handlers> handlers) override {
    timer_.expires_at(withLeeway(due_));
    timer_.async_wait([this, self = shared_from_this(),
                       handlers = std::move(handlers)](const std::error_code& error) mutable {
      const auto now = std::chrono::steady_clock::now();
      due_ += period_;
      if (due_ <= now) due_ += (now - due_) / period_ * period_ + period_;
      happened(error, std::move(handlers));
    });
  }
  void letGo() override {}

  // Full multiples of the leeway, which timers with the same leeway have in common.
  SteadyTime withLeeway(SteadyTime due) const {
    if (leeway_.count() == 0) return due;
    const auto past = due.time_since_epoch() % leeway_;
    return past.count() == 0 ? due : due + (leeway_ - past);
  }

  asio::steady_timer timer_;
  const std::chrono::nanoseconds period_;
  const std::chrono::nanoseconds leeway_;
  SteadyTime due_;
};

class ReadState final : public SourceState {
 public:
  ReadState(Executor& executor, std::string label)
      : SourceState(executor, std::move(label)), descriptor_(executor.context) {}
  ~ReadState() override { ReadState::letGo(); }

  bool assign(int descriptor) {
    std::error_code error;
    descriptor_.assign(descriptor, error);
    return !error;
  }
  void stopWaiting() override {
    std::error_code ignored;
    descriptor_.cancel(ignored);
  }

 private:
  void wait(std::unique_ptr<Handlers> handlers) override {
    descriptor_.async_wait(
        asio::posix::stream_descriptor::wait_read,
        [this, self = shared_from_this(), handlers = std::move(handlers)](
            const std::error_code& error) mutable { happened(error, std::move(handlers)); });
  }
  // The descriptor is somebody else's to close.
  void letGo() override {
    if (descriptor_.is_open()) descriptor_.release();
  }

  asio::posix::stream_descriptor descriptor_;
};

template <class State>
class AsioSource final : public EventSource {
 public:
  explicit AsioSource(std::shared_ptr<State> state) : state_(std::move(state)) {}
  ~AsioSource() override { AsioSource::cancel(); }

  void start(std::function<void()> eventHandler, Task cancelHandler) override {
    if constexpr (std::is_same_v<State, TimerState>) state_->setFirst(std::chrono::steady_clock::now());
    auto handlers =
        std::make_unique<Handlers>(state_->executor(), std::move(eventHandler), std::move(cancelHandler));
    asio::post(state_->executor().context, [state = state_, handlers = std::move(handlers)]() mutable {
      state->begin(std::move(handlers));
    });
  }
  void cancel() override {
    if (!state_->markCancelled() || state_->executor().isEnding.load()) return;
    asio::post(state_->executor().context, [state = state_] { state->stopWaiting(); });
  }

 private:
  std::shared_ptr<State> state_;
};

class AsioWorkQueue final : public WorkQueue {
 public:
  AsioWorkQueue(Executor& executor, std::string label) : executor_(executor), label_(std::move(label)) {}

  void async(Task task) override {
    asio::post(executor_.context, [&executor = executor_, label = label_, task = std::move(task)]() mutable {
      executor.guarded(label, task);
    });
  }
  void after(std::chrono::nanoseconds delay, Task task) override {
    auto owned = std::make_unique<asio::steady_timer>(executor_.context, delay);
    asio::steady_timer& timer = *owned;
    timer.async_wait([&executor = executor_, label = label_, owned = std::move(owned),
                      task = std::move(task)](const std::error_code& error) mutable {
      if (!error) executor.guarded(label, task);
    });
  }
  std::unique_ptr<EventSource> makeTimer(std::chrono::nanoseconds period,
                                         std::chrono::nanoseconds leeway) override {
    if (period.count() <= 0) return nullptr;
    return std::make_unique<AsioSource<TimerState>>(
        std::make_shared<TimerState>(executor_, label_, period, leeway));
  }
  std::unique_ptr<EventSource> makeReadSource(int descriptor) override {
    auto state = std::make_shared<ReadState>(executor_, label_);
    if (!state->assign(descriptor)) return nullptr;
    return std::make_unique<AsioSource<ReadState>>(std::move(state));
  }

 private:
  Executor& executor_;
  const std::string label_;
};

}  // namespace

AsioWorkQueues::AsioWorkQueues(Log& log) : log_(log) {}
AsioWorkQueues::~AsioWorkQueues() = default;

std::shared_ptr<WorkQueue> AsioWorkQueues::makeQueue(std::string label) {
  const std::lock_guard guard(mutex_);
  try {
    if (executor_ == nullptr) executor_ = std::make_unique<Executor>(log_);
  } catch (const std::exception& failure) {  // out of threads or descriptors
    TARNEL_LOG(log_, error, "%s: can't start the thread of the work queues: %s", label.c_str(),
               failure.what());
    return nullptr;
  }
  return std::make_shared<AsioWorkQueue>(*executor_, std::move(label));
}

size_t AsioWorkQueues::sourcesUnderWay() const {
  const std::lock_guard guard(mutex_);
  return executor_ == nullptr ? 0 : executor_->sources.load();
}

}  // namespace tarnel
