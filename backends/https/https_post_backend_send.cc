#include "backends/https/https_post_backend.h"
#include "base/text_format.h"
#include "tarnel/keys.h"

// When events are posted at once, and when they are batched.

namespace tarnel {
namespace {

// Status of the message that ends a session.
constexpr RespCode kSessionTypeStop{1};

MaybeSentObject asSent(MaybeString text) {
  return text ? MaybeSentObject(std::move(*text)) : std::nullopt;
}

}  // namespace

Dictionary HTTPSPostBackend::stopPayload(const Dictionary& payload) const {
  Dictionary stop = payload;
  stop.set("Opt", _dnuType);
  stop.set("SamplingThreshold", samplingThreshold().value_or(Value(-1)));
  stop.set("OverrideSampling", _overrideSampling.value_or(Value(-1)));
  stop.set("Batch", batchEvents() ? 1 : 0);
  return stop;
}

MaybeSentObject HTTPSPostBackend::sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp,
                                              Method method, RespCode respCode, EventID eventID, Flag flag) {
  if (state() == ReportingState::disabled) return std::nullopt;
  auto& log = dependencies().log;
  MaybeDictionary extended;
  if (respCode == kSessionTypeStop) {
    TARNEL_LOG(log, debug,
               "HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP "
               "message dictionary");
    if (payload) {
      extended = stopPayload(*payload);
    } else {
      TARNEL_LOG(log, error, "HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil");
    }
  }
  auto event = newEventDictfromPayload(extended ? extended : payload, timestamp, method, respCode, eventID);
  auto trace = prepareEventForMessage(event);

  if (isImportant(flag) && state() == ReportingState::sampledOut) setState(ReportingState::enabled);
  const bool realtime = isRealtime(flag);
  TARNEL_LOG(log, debug, "HTTPSPostBackend(sendMessage): realtime is %d", realtime);
  if (postsAtOnce(realtime)) return asSent(postEvent(std::move(event), method, respCode, flag));
  TARNEL_LOG(log, debug, "HTTPSPostBackend(sendMessage): Batching %d, %d, %d", static_cast<int>(state()),
             batchEvents(), requireUserInfo());
  return asSent(batchEvent(std::move(event), std::move(trace)));
}

bool HTTPSPostBackend::postsAtOnce(bool realtime) const {
  const auto now = state();
  if (now == ReportingState::undecided || now == ReportingState::sampledOut) return false;
  return (realtime || !batchEvents()) && (!requireUserInfo() || userInfoDict());
}

MaybeString HTTPSPostBackend::postEvent(Dictionary event, Method method, RespCode respCode, Flag flag) {
  auto& log = dependencies().log;
  MaybeString flushedText;
  const bool flushFirst = state() == ReportingState::enabled && isRealtime(flag) && _batchedEvents;
  if (flushFirst) {
    TARNEL_LOG(
        log, debug,
        "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. "
        "Forcing Flush here to keep events in order.");
    flushedText = flushMessagesWithCompletion({});
  }
  TARNEL_LOG(log, debug, "HTTPSPostBackend(sendMessage): Sending %d, %d, %d", static_cast<int>(state()),
             batchEvents(), requireUserInfo());
  Array events;
  events.append(Value(std::move(event)));
  MaybeString pretty;
  auto body = createMessageForPostAndLogging(events, &pretty);
  if (!body) return std::nullopt;
  if (flushFirst) {
    pretty =
        formatText("Flushed events:\n%s\nStandalone event:\n%s", printable(flushedText), printable(pretty));
  }
  postJSONMessage(std::move(*body), flag, method, respCode, {});
  return pretty;
}

}  // namespace tarnel
