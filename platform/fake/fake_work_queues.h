#pragma once

#include <algorithm>
#include <deque>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/work_queue.h"

namespace tarnel::fake {

// Queues whose time passes only when the test says so. Everything runs on the test's thread, out of
// runUntilIdle, advance and signalReadable.
class FakeWorkQueues final : public WorkQueues {
 public:
  using Time = std::chrono::nanoseconds;

  FakeWorkQueues() = default;
  // Lets go of what handlers hold, as the end of the real queues does: a backend and its timer hold each
  // other.
  ~FakeWorkQueues() override {
    const auto sources = std::move(sources_);
    sources_.clear();
    for (const auto& source : sources) source->isCancelled = true;
    for (const auto& source : sources) {
      source->event = nullptr;
      source->cancel = nullptr;
    }
    while (!ready_.empty()) ready_.pop_front();
    delayed_.clear();
  }

  // Set to have the next makings refused.
  bool refuseQueues = false;
  bool refuseTimers = false;
  bool refuseReadSources = false;

  // Set to have queues come from there instead.
  WorkQueues* real = nullptr;

  std::shared_ptr<WorkQueue> makeQueue(std::string label) override {
    if (refuseQueues) return nullptr;
    if (real != nullptr) return real->makeQueue(std::move(label));
    labels.push_back(std::move(label));
    return std::make_shared<Queue>(*this);
  }

  // Runs what was handed over, and what that hands over.
  void runUntilIdle() {
    while (!ready_.empty()) {
      Task task = std::move(ready_.front());
      ready_.pop_front();
      task();
    }
  }
  // Lets time pass: delayed tasks and ticks run in the order in which they are due.
  void advance(Time time) {
    const Time end = now_ + time;
    runUntilIdle();
    for (auto next = earliest(); next != delayed_.end() && next->due <= end; next = earliest()) {
      now_ = next->due;
      Task task = std::move(next->task);
      delayed_.erase(next);
      task();
      runUntilIdle();
    }
    now_ = end;
  }
  // One event for the sources that read this descriptor.
  void signalReadable(int descriptor) {
    for (const auto& source : std::vector<std::shared_ptr<SourceState>>(sources_)) {
      if (source->descriptor == descriptor) fire(source);
    }
    runUntilIdle();
  }

  size_t readyTasks() const { return ready_.size(); }
  // Delayed tasks that are no ticks.
  size_t delayedTasks() const {
    return static_cast<size_t>(
        std::count_if(delayed_.begin(), delayed_.end(), [](const Delayed& d) { return !d.isTick; }));
  }
  size_t timers() const { return count(true); }
  size_t readSources() const { return count(false); }

  // What was asked for, in order.
  std::vector<std::string> labels;
  std::vector<std::pair<Time, Time>> timersMade;  // period and leeway
  std::vector<int> readSourcesMade;               // descriptors

 private:
  struct SourceState {
    int descriptor = -1;
    bool isTimer = false;
    Time period{};
    bool isCancelled = false;
    std::function<void()> event;
    Task cancel;
  };
  struct Delayed {
    Time due;
    bool isTick;
    Task task;
  };

  class Source final : public EventSource {
   public:
    Source(FakeWorkQueues& queues, std::shared_ptr<SourceState> state)
        : queues_(queues), state_(std::move(state)) {}
    ~Source() override { Source::cancel(); }
    void start(std::function<void()> eventHandler, Task cancelHandler) override {
      if (state_->isCancelled) return;
      state_->event = std::move(eventHandler);
      state_->cancel = std::move(cancelHandler);
      queues_.sources_.push_back(state_);
      if (state_->isTimer) queues_.scheduleTick(state_);
    }
    void cancel() override {
      if (std::exchange(state_->isCancelled, true)) return;
      queues_.ready_.emplace_back([&queues = queues_, state = state_] {
        std::erase(queues.sources_, state);
        state->cancel();
        state->event = nullptr;
      });
    }

   private:
    FakeWorkQueues& queues_;
    std::shared_ptr<SourceState> state_;
  };

  class Queue final : public WorkQueue {
   public:
    explicit Queue(FakeWorkQueues& queues) : queues_(queues) {}
    void async(Task task) override { queues_.ready_.push_back(std::move(task)); }
    void after(Time delay, Task task) override {
      queues_.delayed_.push_back({queues_.now_ + delay, false, std::move(task)});
    }
    std::unique_ptr<EventSource> makeTimer(Time period, Time leeway) override {
      queues_.timersMade.emplace_back(period, leeway);
      if (queues_.refuseTimers) return nullptr;
      auto state = std::make_shared<SourceState>();
      state->isTimer = true;
      state->period = period;
      return std::make_unique<Source>(queues_, std::move(state));
    }
    std::unique_ptr<EventSource> makeReadSource(int descriptor) override {
      queues_.readSourcesMade.push_back(descriptor);
      if (queues_.refuseReadSources) return nullptr;
      auto state = std::make_shared<SourceState>();
      state->descriptor = descriptor;
      return std::make_unique<Source>(queues_, std::move(state));
    }

   private:
    FakeWorkQueues& queues_;
  };

  static void fire(const std::shared_ptr<SourceState>& state) {
    if (state->isCancelled || !state->event) return;
    const auto event = state->event;  // stays whole when the source is cancelled by it
    event();
  }
  void scheduleTick(const std::shared_ptr<SourceState>& state) {
    delayed_.push_back({now_ + state->period, true, [this, state] {
                          if (state->isCancelled) return;
                          fire(state);
                          if (!state->isCancelled) scheduleTick(state);
                        }});
  }
  std::vector<Delayed>::iterator earliest() {
    return std::min_element(delayed_.begin(), delayed_.end(),
                            [](const Delayed& a, const Delayed& b) { return a.due < b.due; });
  }
  size_t count(bool timers) const {
    return static_cast<size_t>(
        std::count_if(sources_.begin(), sources_.end(),
                      [timers](const std::shared_ptr<SourceState>& s) { return s->isTimer == timers; }));
  }

  Time now_{};
  std::deque<Task> ready_;
  std::vector<Delayed> delayed_;
  std::vector<std::shared_ptr<SourceState>> sources_;
};

}  // namespace tarnel::fake
