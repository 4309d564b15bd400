#include "client/src/io_loop.h"

#include <poll.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <ctime>
#include <string>
#include <utility>

namespace tarnel::core {
namespace {

using std::chrono::steady_clock;

// Between attempts while the daemon's backlog is full.
constexpr std::chrono::milliseconds kRetryInterval{10};

timespec until(SteadyTime due) {
  const auto left = std::max(due - steady_clock::now(), steady_clock::duration::zero());
  const auto nanoseconds = std::chrono::duration_cast<std::chrono::nanoseconds>(left).count();
  return {static_cast<time_t>(nanoseconds / 1'000'000'000), static_cast<long>(nanoseconds % 1'000'000'000)};
}

// What a call that was under way hears of the connection's end.
Answer forCall(const Outcome& why, const char* when) {
  Answer answer;
  answer.outcome = why.status != TARNEL_ERROR_INTERRUPTED
                       ? why
                       : failure(why.status, std::string("the connection to the daemon was lost ") + when);
  return answer;
}

// The two clocks are one on this platform; "never" stays never.
SteadyTime fromMonotonic(uint64_t microseconds) {
  if (microseconds >= static_cast<uint64_t>(INT64_MAX / 1000)) return SteadyTime::max();
  return SteadyTime(std::chrono::microseconds(static_cast<int64_t>(microseconds)));
}

}  // namespace

IoLoop::IoLoop(const Options& options, const Handlers& handlers, Mailbox& mailbox,
               ForkVisibleDescriptor& socket)
    : options_(options), path_(options.socketPath), handlers_(handlers), mailbox_(mailbox), socket_(socket) {}

IoLoop::~IoLoop() = default;

void IoLoop::run() {
  while (true) {
    const auto orders = mailbox_.orders();
    if (orders.connect) beginConnecting();
    if (hasClosed(orders)) break;
    if (isConnecting_ && !connection_) tryToConnect();
    if (connection_) serve();
    wait(orders);
  }
  disconnect(State::closed, failure(TARNEL_ERROR_CLOSED, "the session is closed"));
}

bool IoLoop::hasClosed(const Mailbox::Orders& orders) {
  if (!orders.close) return false;
  if (steady_clock::now() >= orders.closeBy) return true;
  if (!connection_) return !isConnecting_;
  if (!isReady_ || !mailbox_.isEmpty() || connection_->awaitsAnswers()) return false;
  if (connection_->isSettled()) return true;
  // Calls that asked for no answer are surely read when a later call is answered.
  std::vector<Request> barrier(1);
  barrier.front().kind = Request::Kind::barrier;
  return !connection_->send(std::move(barrier)).ok();
}

void IoLoop::beginConnecting() {
  isConnecting_ = true;
  isReady_ = false;
  connectBy_ = steady_clock::now() + options_.connectTimeout;
}

void IoLoop::tryToConnect() {
  Dialled dialled;
  socket_.change([this, &dialled] {
    dialled = dial(path_);
    return dialled.isBusy || !dialled.outcome.ok() ? -1 : dialled.socket.get();
  });
  if (dialled.isBusy) return;
  if (dialled.outcome.ok()) {
    connection_ = std::make_unique<Connection>(*this, options_.replyTimeout);
    dialled.outcome = connection_->start(std::move(dialled.socket));
  }
  if (!dialled.outcome.ok()) {
    disconnect(dialled.isRefused ? State::invalidated : State::interrupted, dialled.outcome);
  }
}

void IoLoop::serve() {
  const Outcome processed = connection_->process();
  if (!processed.ok()) {
    const bool isRefused = !isReady_ && processed.status == TARNEL_ERROR_INTERRUPTED;
    disconnect(isRefused ? State::invalidated : State::interrupted, whyLost(processed));
    return;
  }
  if (!isReady_ && connection_->isReady()) {
    isReady_ = true;
    isConnecting_ = false;
    mailbox_.setConnected();
  }
  if (isReady_) sendWaiting();
}

Outcome IoLoop::whyLost(const Outcome& lost) const {
  if (isReady_ || lost.status != TARNEL_ERROR_INTERRUPTED) return lost;
  return failure(TARNEL_ERROR_REFUSED,
                 "the daemon closed the connection: this process lacks the entitlement "
                 "com.orvane.private.tarneld, or too many connections are open (see tarneld.conf(5))");
}

bool IoLoop::canSend() const {
  return isReady_ && connection_ && connection_->canSend() &&
         connection_->unanswered() < options_.maxUnanswered;
}

void IoLoop::sendWaiting() {
  while (canSend()) {
    auto requests = mailbox_.take(options_.maxUnanswered - connection_->unanswered());
    if (requests.empty()) return;
    if (const auto sent = connection_->send(std::move(requests)); !sent.ok()) {
      disconnect(State::interrupted, sent);
      return;
    }
  }
}

void IoLoop::wait(const Mailbox::Orders& orders) {
  SteadyTime due = orders.close ? orders.closeBy : SteadyTime::max();
  pollfd polled[2] = {{mailbox_.wakeDescriptor(), POLLIN, 0}, {-1, 0, 0}};
  if (connection_) {
    polled[1] = {connection_->descriptor(), connection_->events(), 0};
    due = std::min(due, fromMonotonic(connection_->dueAt()));
  }
  if (isConnecting_) {
    if (steady_clock::now() >= connectBy_) {
      disconnect(
          State::interrupted,
          failure(TARNEL_ERROR_TIMED_OUT, "the daemon at " + path_ + " did not take the connection within " +
                                              std::to_string(options_.connectTimeout.count()) +
                                              " ms: see systemctl status tarneld"));
      return;
    }
    due =
        std::min(due, connection_ ? connectBy_ : std::min(connectBy_, steady_clock::now() + kRetryInterval));
  }
  if (!mailbox_.mayWait(canSend())) return;
  // The next step of closing needs no event.
  const bool awaitsAnswers = connection_ && connection_->awaitsAnswers();
  if (orders.close && !isConnecting_ && !awaitsAnswers && mailbox_.isEmpty()) return;
  const timespec left = until(due);
  ppoll(polled, 2, due == SteadyTime::max() ? nullptr : &left, nullptr);
  if (polled[0].revents != 0) mailbox_.clearWake();
}

void IoLoop::disconnect(State state, const Outcome& why) {
  isConnecting_ = false;
  isReady_ = false;
  std::vector<Request> unanswered;
  if (connection_) {
    socket_.change([this, &unanswered] {
      unanswered = connection_->takeUnanswered();
      return -1;
    });
    connection_.reset();
  }
  std::deque<Request> waiting = mailbox_.setDisconnected(state, why);
  const auto lostCalls = static_cast<uint64_t>(std::count_if(
      waiting.begin(), waiting.end(), [](const Request& request) { return !request.completion; }));
  for (Request& request : unanswered) answered(request, forCall(why, "before it answered"));
  for (Request& request : waiting) answered(request, forCall(why, "before this was sent"));
  if (mailbox_.isMuted() || state == State::closed) return;
  const auto& handler = state == State::invalidated ? handlers_.invalidation : handlers_.interruption;
  if (handler) handler(why, lostCalls);
}

void IoLoop::answered(Request& request, const Answer& answer) {
  if (!request.completion) return;
  if (mailbox_.isMuted()) {
    parked_.push_back(std::move(request.completion));
  } else {
    request.completion(answer);
  }
}

void IoLoop::aggregated(const MaybeDictionary& messageInfo, double timestamp, uint16_t category,
                        uint16_t type, const MaybeDictionary& payload) {
  if (mailbox_.isMuted()) return;
  const bool isEnd = !messageInfo && timestamp == 0 && category == 0 && type == 0 && !payload;
  if (isEnd) {
    if (handlers_.aggregationEnd) handlers_.aggregationEnd();
  } else if (handlers_.aggregatedMessage) {
    handlers_.aggregatedMessage(messageInfo, timestamp, category, type, payload);
  }
}

}  // namespace tarnel::core
