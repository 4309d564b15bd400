#include "backends/https/batch_poster.h"
#include "backends/https/https_post_backend.h"
#include "tarnel/keys.h"

// When a batch is posted, kept or discarded, and how its events are relabelled.

namespace tarnel {
namespace {

Error flushError(const char* text) {
  return {kTarnelErrorDomain, -1, text};
}

}  // namespace

bool HTTPSPostBackend::lacksUserInfo() const {
  return requireUserInfo() && !userInfoDict();
}

bool HTTPSPostBackend::canFlush() const {
  return state() == ReportingState::enabled && !lacksUserInfo();
}

// The counts per method stay: they are of what came since the last post.
void HTTPSPostBackend::discardBatch() {
  _batchedEvents.reset();
  _batchOverflowed = false;
}

EventBatch::Finish HTTPSPostBackend::finishOfFlush() const {
  EventBatch::Finish finish;
  const bool again = dependencies().filterHeldEvents;
  if (again) finish.filters = _filters;
  if (!userInfoDict()) return finish;
  finish.fields = *userInfoDict();
  // Its own method and status, where it holds none 0, whatever they are in the events.
  auto trace = EventFilters::traceOf(finish.fields);
  _filters.filterAgain(finish.fields, trace);
  finish.digested = std::move(trace.digested);
  return finish;
}

// Usually one message. Held events may become much larger by the user information that comes with the flush;
// then there are several, none of them larger than a batch may be.
MaybeString HTTPSPostBackend::postBatch(FlushCompletion completion) {
  // The batch is given away last, so that nothing of it is lost when there is no memory for the rest.
  auto finish = finishOfFlush();
  auto poster = messagePoster(Flag::normal, std::nullopt, std::nullopt);
  const auto posting =
      std::make_shared<BatchPoster>(std::move(*_batchedEvents), std::move(finish), messageWriter(),
                                    std::move(poster), std::move(completion));
  discardBatch();
  _eventMethodCounts.clear();
  auto text = posting->makeFirst();
  if (auto rest = posting->takeRefused()) _batchedEvents = std::move(*rest);
  posting->start();
  return text;
}

MaybeString HTTPSPostBackend::flushMessagesWithCompletion(FlushCompletion completion) {
  // Undecided for want of user information, the events may still be wanted when it comes.
  const auto now = state();
  const bool isWaiting = now == ReportingState::undecided && lacksUserInfo();
  if (now != ReportingState::enabled && !isWaiting) discardBatch();
  if (!_batchedEvents) {
    completion(std::nullopt, flushError("Nothing to flush"));
    return std::nullopt;
  }
  if (lacksUserInfo()) {
    completion(std::nullopt, flushError("Can not flush: userInfo is required"));
    return std::nullopt;
  }
  TARNEL_LOG(dependencies().log, debug, "HTTPSPostBackend(flushMessagesWithCompletion): called");
  return postBatch(std::move(completion));
}

void HTTPSPostBackend::setCorrelatedSessionID(const MaybeString& correlatedSessionID) {
  setCombinedSessionIDString(correlatedSessionID);
  if (!_batchedEvents || !correlatedSessionID) return;
  _batchedEvents->labelAll({{"_sessionID", *correlatedSessionID}});
}

}  // namespace tarnel
