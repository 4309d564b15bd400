#include "backends/https/message_writer.h"

#include <algorithm>
#include <utility>

#include "formats/json_writer.h"

namespace tarnel {
namespace {

bool mayStandInEvent(const Value& value) {
  return value.string() != nullptr || value.isNumber();
}

void logRemoval(Log& log, const std::string& key, const Value& value) {
  TARNEL_LOG(
      log, warning,
      "HTTPSPostBackend(createMessageForPostAndLogging): JSONWriter unable to handle key: %s, value: %s",
      key.c_str(), value.description().c_str());
}

// The tree shares the events; nothing of them is copied.
Dictionary messageFrom(double postTime, const MaybeString& clientId, const Array& events) {
  Dictionary message;
  message.set("postTime", postTime);
  // Events that nobody's identifier stands for could not be told apart from a stranger's: they stay here.
  if (!clientId) return message;
  message.set("clientId", *clientId);
  message.set("events", events);
  return message;
}

// Text that is not UTF-8 and numbers that are not finite cannot be written. Such a value goes, like any other
// that may not stand in an event, so that the rest of the batch arrives.
void removeUnwritable(Log& log, Array& events) {
  std::string scratch;
  for (auto& event : events.mutableValues()) {
    if (event.mutableDictionary() == nullptr) continue;
    event.mutableDictionary()->editEntries([&log, &scratch](const std::string& key, Value& value) {
      scratch.clear();
      if (isValidUtf8(key) && writeJson(value, JsonStyle::compact, scratch)) return true;
      logRemoval(log, key, value);
      return false;
    });
  }
}

void keepWritableValues(Log& log, Dictionary& event) {
  const bool allMayStand = std::all_of(event.begin(), event.end(), [](const Dictionary::Entry& entry) {
    return mayStandInEvent(entry.second);
  });
  if (allMayStand) return;
  event.editEntries([&log](const std::string& key, Value& value) {
    if (const auto* date = value.date()) {
      // Here alone an infinite time can come in: clients give dates as they like.
      value = Value(finiteOrMinusOne(date->seconds));
      return true;
    }
    if (mayStandInEvent(value)) return true;
    logRemoval(log, key, value);
    return false;
  });
}

}  // namespace

std::optional<std::string> MessageWriter::write(Array& events, MaybeString* pretty) const {
  // Finite, since the clock gives integers; what is not finite would be a message that cannot be written.
  const double postTime = finiteOrMinusOne(secondsFromTimeValue(clock.timeOfDay()));
  for (auto& event : events.mutableValues()) {
    if (auto* fields = event.mutableDictionary()) keepWritableValues(log, *fields);
  }
  auto message = messageFrom(postTime, clientId, events);
  std::string body;
  if (!writeJson(message, JsonStyle::compact, body)) {
    message = Dictionary();
    removeUnwritable(log, events);
    message = messageFrom(postTime, clientId, events);
    if (!writeJson(message, JsonStyle::compact, body)) return std::nullopt;
  }
  if (pretty != nullptr && mayMakePretty) {
    std::string indented;
    if (writeJson(message, JsonStyle::pretty, indented)) *pretty = std::move(indented);
  }
  return body;
}

}  // namespace tarnel
