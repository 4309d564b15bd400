#include "util/uploads.h"

#include <algorithm>
#include <map>
#include <set>
#include <utility>

namespace tarnel {

struct Uploads::State {
  // Who waits for room. Each is woken for itself, when its turn has come, and not by what others wait for.
  struct Waiting {
    uint32_t owner;
    std::condition_variable& turn;
  };

  // A request under way, shared with its completion. Guarded by mutex.
  struct Call {
    std::condition_variable ended;
    std::optional<HttpResult> result;
  };

  // Lists the call as long as it exists itself, so that stop() ends its wait.
  class Listed {
   public:
    Listed(State& state, std::shared_ptr<Call> call) : state_(state), call_(std::move(call)) {
      const std::lock_guard lock(state_.mutex);
      if (!state_.isStopped) isListed_ = state_.calls.insert(call_).second;
    }
    Listed(const Listed&) = delete;
    Listed& operator=(const Listed&) = delete;
    ~Listed() {
      const std::lock_guard lock(state_.mutex);
      state_.calls.erase(call_);
    }
    // Not when the uploads are stopped.
    bool isListed() const noexcept { return isListed_; }

   private:
    State& state_;
    const std::shared_ptr<Call> call_;
    bool isListed_ = false;
  };

  std::mutex mutex;
  // All guarded by mutex.
  std::list<Waiting> waiting;  // in order
  std::set<std::shared_ptr<Call>> calls;
  std::map<uint32_t, uint64_t> lastTurn;  // of each owner, counted; of none when all is quiet
  uint64_t turns = 0;
  uint64_t bytes = 0;
  bool isStopped = false;

  uint64_t lastTurnOf(uint32_t owner) const {
    const auto found = lastTurn.find(owner);
    return found == lastTurn.end() ? 0 : found->second;
  }
  // Whose turn it is; somebody waits.
  std::list<Waiting>::const_iterator next() const {
    return std::min_element(waiting.begin(), waiting.end(), [this](const Waiting& a, const Waiting& b) {
      return lastTurnOf(a.owner) < lastTurnOf(b.owner);
    });
  }
  // Under the mutex, since who waits may go as soon as it is free.
  void wakeNext() {
    if (!waiting.empty()) next()->turn.notify_one();
  }
};

namespace {

constexpr char kDaemonEnds[] = "the daemon ends";

HttpResult goingAway(const char* why) {
  return {std::nullopt, std::nullopt, Error(kHttpErrorDomain, kHttpClientGoingAway, why)};
}

}  // namespace

Uploads::Uploads(ClientFiles& files, UploadLimits limits)
    : files_(files), limits_(limits), state_(std::make_shared<State>()) {}

std::optional<Uploads::Place> Uploads::enter(uint64_t bytes, uint32_t owner) {
  std::condition_variable turn;
  std::unique_lock lock(state_->mutex);
  const auto self = state_->waiting.insert(state_->waiting.end(), {owner, turn});
  const auto isOver = [this, self, bytes] {
    const bool hasRoom = state_->bytes == 0 || (state_->bytes <= limits_.bytesUnderWay &&
                                                bytes <= limits_.bytesUnderWay - state_->bytes);
    return state_->isStopped || (hasRoom && self == state_->next());
  };
  const bool hasTurn = turn.wait_for(lock, limits_.waitForRoom, isOver) && !state_->isStopped;
  state_->waiting.erase(self);
  if (hasTurn) {
    state_->lastTurn[owner] = ++state_->turns;
    state_->bytes += bytes;
  }
  state_->wakeNext();  // it is another's turn now, and there may be room for it
  if (!hasTurn) return std::nullopt;
  return Place(*this, bytes);
}

size_t Uploads::waiting() const {
  const std::lock_guard lock(state_->mutex);
  return state_->waiting.size();
}

void Uploads::leave(uint64_t bytes) {
  const std::lock_guard lock(state_->mutex);
  state_->bytes -= bytes;
  if (state_->bytes == 0 && state_->waiting.empty()) state_->lastTurn.clear();
  state_->wakeNext();
}

HttpResult Uploads::perform(HttpClient& http, HttpRequest request) {
  // Answered by the completion, or, when that is dropped uncalled, by its destruction.
  class Answer {
   public:
    Answer(std::shared_ptr<State> state, std::shared_ptr<State::Call> call)
        : state_(std::move(state)), call_(std::move(call)) {}
    Answer(const Answer&) = delete;
    Answer& operator=(const Answer&) = delete;
    Answer(Answer&&) = default;
    Answer& operator=(Answer&&) = delete;
    ~Answer() {
      if (state_ != nullptr) give(goingAway("the HTTP client dropped the request"));
    }
    void give(HttpResult result) {
      {
        const std::lock_guard lock(state_->mutex);
        if (call_->result) return;
        call_->result = std::move(result);
      }
      call_->ended.notify_one();
    }

   private:
    std::shared_ptr<State> state_;
    std::shared_ptr<State::Call> call_;
  };
  const auto call = std::make_shared<State::Call>();
  const State::Listed listed(*state_, call);
  if (!listed.isListed()) return goingAway(kDaemonEnds);
  http.startDataTask(std::move(request), [answer = Answer(state_, call)](HttpResult given) mutable {
    answer.give(std::move(given));
  });
  std::unique_lock lock(state_->mutex);
  call->ended.wait(lock, [this, &call] { return call->result || state_->isStopped; });
  if (!call->result) return goingAway(kDaemonEnds);
  return *std::move(call->result);
}

void Uploads::stop() {
  const std::lock_guard lock(state_->mutex);
  state_->isStopped = true;
  for (const auto& one : state_->waiting) one.turn.notify_one();
  for (const auto& call : state_->calls) call->ended.notify_one();
}

}  // namespace tarnel
