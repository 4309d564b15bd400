#include "backends/https/https_post_backend.h"
#include "backends/https/sender_names.h"
#include "base/text_format.h"

// How a message becomes an event, and how events are batched.

namespace tarnel {
namespace {

// The standard fields, and room for what the session adds at its end.
constexpr size_t kStandardFields = 20;

int64_t wholeMinute(double seconds) {
  return Value(seconds).int64Value() / 60 * 60;
}

}  // namespace

const std::string& HTTPSPostBackend::reportVersion() {
  const auto version = static_cast<uint16_t>(selfVersionMajor() << 8U | selfVersionMinor());
  if (_reportVersion.empty() || _reportVersionOf != version) {
    _reportVersion = formatText("%u.%u", unsigned{selfVersionMajor()}, unsigned{selfVersionMinor()});
    _reportVersionOf = version;
  }
  return _reportVersion;
}

// Asked once a second: the answer is the same within it, and asking takes the C library's lock.
int32_t HTTPSPostBackend::timeZoneOffset() {
  const int64_t now = dependencies().clock.timeOfDay().seconds;
  if (_timeZoneSecond != now) {
    _timeZoneOffset = dependencies().locale.secondsFromGMT(now);
    _timeZoneSecond = now;
  }
  return _timeZoneOffset;
}

Dictionary HTTPSPostBackend::newEventDictfromPayload(const MaybeDictionary& payload,
                                                     const TimeValue& timestamp, Method method,
                                                     RespCode respCode, EventID /*eventID*/) {
  const int64_t startTS = wholeMinute(startTimeStamp());
  // Only the offset into the session is sent, so that its exact start stays on the device. Times are
  // integers, so that no clock makes it infinite; -1 stands for what a message may not hold all the same.
  const double clientTS =
      finiteOrMinusOne(static_cast<double>(startTS) + (secondsFromTimeValue(timestamp) - startTimeStamp()));
  const size_t more = kStandardFields + (userInfoDict() ? userInfoDict()->size() : 0);
  Dictionary event = (payload ? *payload : Dictionary()).copyWithRoomFor(more);
  event.set("_startTS", startTS);
  event.set("_sender", senderName(compType()));
  event.set("_clientVersion", clientVersion());
  if (isInternal() && (compType() == 7 || compType() == 11 || compType() == 13)) {
    event.set("_sessionID", sessionID());
  } else if (combinedSessionIDString()) {
    event.set("_sessionID", *combinedSessionIDString());
  }
  event.set("_eventNumber", eventID());
  event.set("_method", static_cast<uint16_t>(method));
  event.set("_status", static_cast<uint16_t>(respCode));
  event.set("_clientTS", clientTS);
  event.set("eventTime", clientTS);
  event.set("_productFamily", productFamily().value_or(""));
  event.set("_productModel", hardwareType().value_or(""));
  if (productVersion()) event.set("_osVersion", *productVersion());
  if (buildVersion()) event.set("_build", *buildVersion());
  event.set("_internal", dependencies().process.isInternalBuild() ? 3 : 2);
  event.set("_reportVers", reportVersion());
  event.set("_timezoneOffset", timeZoneOffset());
  return event;
}

FilterTrace HTTPSPostBackend::prepareEventForMessage(Dictionary& event) const {
  if (userInfoDict()) event.merge(*userInfoDict());
  if (!dependencies().filterHeldEvents) {
    _filters.filterEvent(event);
    return {};
  }
  auto trace = EventFilters::traceOf(event);
  _filters.filterAgain(event, trace);
  return trace;
}

MaybeString HTTPSPostBackend::batchEvent(Dictionary event, FilterTrace trace) {
  if (!_batchedEvents) _batchedEvents.emplace();
  // User information or a filter may have replaced the number; the key stays within its 16 bits, so that the
  // counts are bounded.
  const auto* methodValue = event.find("_method");
  const uint16_t method = methodValue == nullptr ? uint16_t{0} : methodValue->uint16Value();
  const auto found = _eventMethodCounts.find(method);
  int64_t count = found == _eventMethodCounts.end() ? 0 : found->second;
  const size_t bytes = EventBatch::estimateSize(event, trace);

  MaybeString flushed;
  if (count > _eventThreshold) {
    TARNEL_LOG(dependencies().log, debug,
               "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for "
               "method %d",
               int{method});
    flushed = flushMessagesWithCompletion({});
    count = 0;
  } else if (canFlush() && !_batchedEvents->hasRoomFor(bytes)) {
    flushed = flushMessagesWithCompletion({});
    count = 0;
  }
  if (!_batchedEvents) _batchedEvents.emplace();
  if (_batchedEvents->makeRoomFor(bytes) != 0 && !_batchOverflowed) {
    _batchOverflowed = true;
    TARNEL_LOG(
        dependencies().log, warning,
        "HTTPSPostBackend(batchEvent): %s: %zu events are held; dropping the oldest to stay within %zu "
        "events and %zu bytes",
        name().c_str(), _batchedEvents->size(), EventBatch::kMaxEvents, EventBatch::kMaxBytes);
  }
  _batchedEvents->append(std::move(event), bytes, std::move(trace));
  _eventMethodCounts[method] = count + 1;
  return flushed;
}

}  // namespace tarnel
