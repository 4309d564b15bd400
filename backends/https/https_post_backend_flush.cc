#include "backends/https/flush_join.h"
#include "backends/https/https_post_backend.h"
#include "tarnel/keys.h"

// When a batch is posted, kept or discarded, and how its events are relabelled.

namespace tarnel {
namespace {

Error flushError(const char* text) {
  return {kTarnelErrorDomain, -1, text};
}

// Texts for the log, one after the other. The log of a flush is bounded like a batch.
class PostedTexts {
 public:
  // Where the next text goes; null when no more is taken.
  MaybeString* next() { return all_ && all_->size() >= EventBatch::kMaxBytes ? nullptr : &next_; }
  void take() {
    if (next() == nullptr) {
      ++leftOut_;
    } else if (next_) {
      if (all_) all_->append("\n").append(*next_);
      if (!all_) all_ = std::move(next_);
      next_.reset();
    }
  }
  MaybeString result() {
    if (leftOut_ != 0) all_->append("\n(and " + std::to_string(leftOut_) + " more messages)");
    return std::move(all_);
  }

 private:
  MaybeString all_;
  MaybeString next_;
  size_t leftOut_ = 0;
};

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
  if (again) finish.filters = &_filters;
  if (!userInfoDict()) return finish;
  finish.fields = *userInfoDict();
  // It has no method and status of its own: both count as 0, whatever they are in the events.
  auto trace = EventFilters::traceOf(finish.fields);
  _filters.filterAgain(finish.fields, trace);
  finish.digested = std::move(trace.digested);
  return finish;
}

// Usually one message. Held events may become much larger by the user information that comes with the flush;
// then there are several, none of them larger than a batch may be.
MaybeString HTTPSPostBackend::postBatch(FlushCompletion completion) {
  auto batch = std::move(*_batchedEvents);
  discardBatch();
  _eventMethodCounts.clear();
  const auto finish = finishOfFlush();
  const auto join = std::make_shared<FlushJoin>(std::move(completion));
  PostedTexts texts;
  // A batch without events is a message, too.
  do {
    auto events = batch.takeEvents(finish);
    join->expectOne();
    auto body = createMessageForPostAndLogging(events, texts.next());
    events = Array();
    if (!body) {
      join->completeOne(flushError("Can not flush: the events can not be written as JSON"));
      continue;
    }
    texts.take();
    postJSONMessage(
        std::move(*body), Flag::normal, std::nullopt, std::nullopt,
        [join](const MaybeString& /*text*/, MaybeError error) { join->completeOne(std::move(error)); });
  } while (batch.size() > 0);
  auto text = texts.result();
  join->allExpected(text);
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
