#include "util/uploads.h"

#include <algorithm>
#include <map>
#include <utility>

namespace tarnel {

struct Uploads::State {
  std::mutex mutex;
  std::condition_variable changed;
  // All guarded by mutex.
  std::list<uint32_t> waiting;            // the owner of each, in order
  std::map<uint32_t, uint64_t> lastTurn;  // of each owner, counted; of none when all is quiet
  uint64_t turns = 0;
  uint64_t bytes = 0;
  bool isStopped = false;

  uint64_t lastTurnOf(uint32_t owner) const {
    const auto found = lastTurn.find(owner);
    return found == lastTurn.end() ? 0 : found->second;
  }
  // Whose turn it is; somebody waits.
  std::list<uint32_t>::const_iterator next() const {
    return std::min_element(waiting.begin(), waiting.end(),
                            [this](uint32_t a, uint32_t b) { return lastTurnOf(a) < lastTurnOf(b); });
  }
};

namespace {

HttpResult goingAway(const char* why) {
  return {std::nullopt, std::nullopt, Error(kHttpErrorDomain, kHttpClientGoingAway, why)};
}

}  // namespace

Uploads::Uploads(ClientFiles& files, UploadLimits limits)
    : files_(files), limits_(limits), state_(std::make_shared<State>()) {}

std::optional<Uploads::Place> Uploads::enter(uint64_t bytes, uint32_t owner) {
  std::unique_lock lock(state_->mutex);
  const auto self = state_->waiting.insert(state_->waiting.end(), owner);
  const auto isOver = [this, self, bytes] {
    const bool hasRoom = state_->bytes == 0 || (state_->bytes <= limits_.bytesUnderWay &&
                                                bytes <= limits_.bytesUnderWay - state_->bytes);
    return state_->isStopped || (hasRoom && self == state_->next());
  };
  const bool hasTurn = state_->changed.wait_for(lock, limits_.waitForRoom, isOver) && !state_->isStopped;
  state_->waiting.erase(self);
  if (hasTurn) state_->lastTurn[owner] = ++state_->turns;
  state_->changed.notify_all();  // it is another's turn now
  if (!hasTurn) return std::nullopt;
  state_->bytes += bytes;
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
  state_->changed.notify_all();
}

HttpResult Uploads::perform(HttpClient& http, HttpRequest request) {
  // Answered by the completion, or, when that is dropped uncalled, by its destruction.
  class Answer {
   public:
    Answer(std::shared_ptr<State> state, std::shared_ptr<std::optional<HttpResult>> result)
        : state_(std::move(state)), result_(std::move(result)) {}
    Answer(const Answer&) = delete;
    Answer& operator=(const Answer&) = delete;
    Answer(Answer&&) = default;
    Answer& operator=(Answer&&) = delete;
    ~Answer() {
      if (state_ != nullptr) give(goingAway("the HTTP client dropped the request"));
    }
    void give(HttpResult result) {
      const std::lock_guard lock(state_->mutex);
      if (result_->has_value()) return;
      *result_ = std::move(result);
      state_->changed.notify_all();
    }

   private:
    std::shared_ptr<State> state_;
    std::shared_ptr<std::optional<HttpResult>> result_;
  };
  const auto result = std::make_shared<std::optional<HttpResult>>();
  http.startDataTask(std::move(request), [answer = Answer(state_, result)](HttpResult given) mutable {
    answer.give(std::move(given));
  });
  std::unique_lock lock(state_->mutex);
  state_->changed.wait(lock, [this, &result] { return result->has_value() || state_->isStopped; });
  if (!result->has_value()) return goingAway("the daemon ends");
  return *std::move(*result);
}

void Uploads::stop() {
  const std::lock_guard lock(state_->mutex);
  state_->isStopped = true;
  state_->changed.notify_all();
}

}  // namespace tarnel
