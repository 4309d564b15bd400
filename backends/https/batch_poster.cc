#include "backends/https/batch_poster.h"

#include <atomic>
#include <exception>
#include <utility>

#include "tarnel/keys.h"

namespace tarnel {
namespace {

std::atomic<size_t> waitingBatches{0};

bool beginWaiting() {
  size_t count = waitingBatches.load();
  while (count < BatchPoster::kMaxWaiting) {
    if (waitingBatches.compare_exchange_weak(count, count + 1)) return true;
  }
  return false;
}

Error flushError(std::string text) {
  return {kTarnelErrorDomain, -1, std::move(text)};
}

Error errorOf(const std::exception& exception) {
  return flushError(std::string("Can not flush: ") + exception.what());
}

// After a server error the backend is disabled. What the HTTP client refuses unsent it would refuse again:
// making the rest only for that would keep the thread of all transfers busy.
bool isLast(const Error& error) {
  if (error.domain() == kTarnelErrorDomain) return error.code() >= 500 && error.code() <= 599;
  if (error.domain() != kHttpErrorDomain) return false;
  return error.code() == kHttpClientGoingAway || error.code() == kHttpTooMuchQueued ||
         error.code() == kHttpBadRequest;
}

}  // namespace

BatchPoster::BatchPoster(EventBatch batch, EventBatch::Finish finish, MessageWriter writer,
                         MessagePoster poster, FlushCompletion completion)
    : batch_(std::move(batch)),
      finish_(std::move(finish)),
      writer_(std::move(writer)),
      poster_(std::move(poster)),
      completion_(std::move(completion)) {}

BatchPoster::~BatchPoster() {
  if (waits_) --waitingBatches;
}

MaybeString BatchPoster::makeFirst() {
  makeMessage();
  auto text = texts_.text();
  if (text && batch_.size() > 0) text->append("\n(and more messages)");
  return text;
}

std::optional<EventBatch> BatchPoster::takeRefused() {
  if (batch_.size() == 0) return std::nullopt;
  waits_ = beginWaiting();
  if (waits_) return std::nullopt;
  TARNEL_LOG(
      writer_.log, warning,
      "HTTPSPostBackend(flushMessagesWithCompletion): %s: %zu events wait for the next flush: too many "
      "batches are being posted",
      poster_.name.c_str(), batch_.size());
  noteError(flushError("Can not flush all events: too many batches are being posted"));
  return std::exchange(batch_, EventBatch());
}

void BatchPoster::start() {
  if (postMessage()) goOn();
}

// After an answer. A loop, however many messages are answered before their post returns.
void BatchPoster::goOn() {
  do {
    if (batch_.size() > 0) {
      if (const auto why = reasonToStop()) dropRest(*why);
    }
    if (batch_.size() == 0) {
      completion_(texts_.result(), std::move(firstError_));
      return;
    }
    makeMessage();
  } while (postMessage());
}

void BatchPoster::makeMessage() {
  const size_t held = batch_.size();
  body_.reset();
  try {
    auto events = batch_.takeEvents(finish_);
    events_ = events.size();
    body_ = writer_.write(events, texts_.next());
    if (body_) {
      texts_.take();
    } else {
      noteError(flushError("Can not flush: the events can not be written as JSON"));
    }
  } catch (const std::exception& exception) {
    body_.reset();
    const Error error = errorOf(exception);
    noteError(error);
    logLoss(held - batch_.size(), error);
    // It would fail for ever.
    if (batch_.size() == held) dropRest(error);
  }
}

// True when the message is answered. Else its answer goes on, maybe already, and nothing here may be touched
// any more.
bool BatchPoster::postMessage() {
  if (!body_) return true;
  size_t message = 0;
  {
    const std::lock_guard guard(lock_);
    message = ++message_;
    stage_ = Stage::starting;
  }
  try {
    poster_.post(std::move(*body_),
                 [self = shared_from_this(), message](const MaybeString& /*text*/, MaybeError error) {
                   self->answered(message, std::move(error));
                 });
  } catch (const std::exception& exception) {
    const Error error = errorOf(exception);
    if (answered(message, error)) logLoss(events_, error);
  }
  const std::lock_guard guard(lock_);
  if (stage_ == Stage::answered) return true;
  stage_ = Stage::waiting;
  return false;
}

bool BatchPoster::answered(size_t message, MaybeError error) {
  {
    const std::lock_guard guard(lock_);
    // A post that fails with an exception may have been answered.
    if (message != message_ || stage_ == Stage::answered) return false;
    if (error && (isLast(*error) || !poster_.url)) reasonToStop_ = error;
    if (!firstError_) firstError_ = std::move(error);
    // Whoever still starts it goes on when that returns.
    if (std::exchange(stage_, Stage::answered) == Stage::starting) return true;
  }
  goOn();
  return true;
}

MaybeError BatchPoster::reasonToStop() {
  {
    const std::lock_guard guard(lock_);
    if (reasonToStop_) return reasonToStop_;
  }
  // Consent may have gone, say.
  if (!poster_.isBackendDisabled()) return std::nullopt;
  auto error = flushError("Can not flush: the backend is disabled");
  noteError(error);
  return error;
}

void BatchPoster::noteError(MaybeError error) {
  const std::lock_guard guard(lock_);
  if (!firstError_) firstError_ = std::move(error);
}

void BatchPoster::dropRest(const Error& why) {
  logLoss(batch_.size(), why);
  batch_ = EventBatch();
}

void BatchPoster::logLoss(size_t events, const Error& why) const {
  if (events == 0) return;
  TARNEL_LOG(writer_.log, error, "HTTPSPostBackend(flushMessagesWithCompletion): %s: %zu events are lost: %s",
             poster_.name.c_str(), events, why.localizedDescription().c_str());
}

}  // namespace tarnel
