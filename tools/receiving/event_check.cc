#include "tools/receiving/event_check.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>

#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

using Check = bool (*)(const Value& value);

const int64_t* wholeNumber(const Value& value) {
  return value.integer();
}

bool isWhole(const Value& value) {
  return wholeNumber(value) != nullptr;
}
bool isWholeMinute(const Value& value) {
  return isWhole(value) && *wholeNumber(value) % 60 == 0;
}
bool is16Bits(const Value& value) {
  return isWhole(value) && *wholeNumber(value) >= 0 && *wholeNumber(value) <= UINT16_MAX;
}
bool isPlainNumber(const Value& value) {
  return value.isNumber() && value.boolean() == nullptr;
}
bool isText(const Value& value) {
  return value.string() != nullptr;
}
bool isSession(const Value& value) {
  return isText(value) || (isWhole(value) && *wholeNumber(value) >= 0 && *wholeNumber(value) <= UINT32_MAX);
}
bool isInternalMark(const Value& value) {
  return isWhole(value) && (*wholeNumber(value) == 2 || *wholeNumber(value) == 3);
}
bool isReportVersion(const Value& value) {
  if (!isText(value)) return false;
  const std::string& text = *value.string();
  const size_t dot = text.find('.');
  if (dot == std::string::npos) return false;
  const auto major = parseNumber(std::string_view(text).substr(0, dot));
  const auto minor = parseNumber(std::string_view(text).substr(dot + 1));
  return major && minor && *major <= UINT8_MAX && *minor <= UINT8_MAX;
}
bool isZoneOffset(const Value& value) {
  return isWhole(value) && std::abs(*wholeNumber(value)) <= 16 * 3600;
}

struct FieldRule {
  const char* key;
  Check check;
  bool required;
  const char* must;
};

constexpr std::array kFieldRules = {
    FieldRule{"_startTS", isWholeMinute, true, "whole seconds of a whole minute"},
    FieldRule{"_sender", isText, true, "a text"},
    FieldRule{"_clientVersion", is16Bits, true, "a whole number from 0 to 65535"},
    FieldRule{"_sessionID", isSession, false, "a text or a whole number of 32 bits"},
    FieldRule{"_eventNumber", is16Bits, true, "a whole number from 0 to 65535"},
    FieldRule{"_method", is16Bits, true, "a whole number from 0 to 65535"},
    FieldRule{"_status", is16Bits, true, "a whole number from 0 to 65535"},
    FieldRule{"_clientTS", isPlainNumber, true, "a number"},
    FieldRule{"eventTime", isPlainNumber, true, "a number"},
    FieldRule{"_productFamily", isText, true, "a text"},
    FieldRule{"_productModel", isText, true, "a text"},
    FieldRule{"_osVersion", isText, false, "a text"},
    FieldRule{"_build", isText, false, "a text"},
    FieldRule{"_internal", isInternalMark, true, "2 or 3"},
    FieldRule{"_reportVers", isReportVersion, true, "two numbers with a dot"},
    FieldRule{"_timezoneOffset", isZoneOffset, true, "whole seconds"}};

const char* containerName(const Value& value) {
  switch (value.type()) {
    case Value::Type::null:
      return "null";
    case Value::Type::array:
      return "a list";
    case Value::Type::dictionary:
      return "a dictionary";
    case Value::Type::data:
      return "data";
    case Value::Type::date:
      return "a date that is no number";
    default:
      return nullptr;
  }
}

void checkUserAgent(const std::string& agent, Problems& problems) {
  unsigned int major = 0;
  unsigned int minor = 0;
  int end = 0;
  const int fields = std::sscanf(agent.c_str(), "Tarnel/%3u.%3u (%n", &major, &minor, &end);
  if (fields != 2 || end == 0 || agent.back() != ')' || agent.find("; ") == std::string::npos) {
    problems.add("header User-Agent: must read \"Tarnel/MAJOR.MINOR (MODEL; VERSION)\", but reads \"" +
                 printable(agent, 80) + "\"");
  }
}

void checkFixedHeader(const NameValues& headers, const char* name, Problems& problems) {
  const std::string* value = findHeader(headers, name);
  if (value == nullptr) {
    problems.add(std::string("header ") + name + ": missing");
  } else if (*value != "application/json") {
    problems.add(std::string("header ") + name + ": must be application/json, but is \"" +
                 printable(*value, 80) + "\"");
  }
}

// A header that repeats what stands in every event.
template <class Differs>
void checkAgainstEvents(const char* header, const char* field, const PostMessage& message, Differs differs,
                        Problems& problems) {
  for (size_t i = 0; i < message.events.size(); ++i) {
    const Dictionary* event = message.events[i].dictionary();
    const Value* value = event != nullptr ? event->find(field) : nullptr;
    if (value != nullptr && differs(*value)) {
      problems.add("header " + std::string(header) + ": differs from event " + std::to_string(i + 1) + "'s " +
                   field);
      return;
    }
  }
}

void checkVersionHeader(const NameValues& headers, const PostMessage& message, Problems& problems) {
  const std::string* version = findHeader(headers, "X-TRN-Client-Version");
  if (version == nullptr) {
    problems.add("header X-TRN-Client-Version: missing");
    return;
  }
  const std::optional<uint64_t> number = parseNumber(*version);
  if (!number || *number > UINT16_MAX) {
    problems.add("header X-TRN-Client-Version: must be a whole number from 0 to 65535");
    return;
  }
  checkAgainstEvents(
      "X-TRN-Client-Version", "_clientVersion", message,
      [&number](const Value& value) { return value.isNumber() && value.uint64Value() != *number; }, problems);
}

void checkSenderHeader(const NameValues& headers, const PostMessage& message, Problems& problems) {
  const std::string* sender = findHeader(headers, "X-TRN-Sender");
  if (sender == nullptr || sender->empty()) {
    problems.add("header X-TRN-Sender: missing");
    return;
  }
  checkAgainstEvents(
      "X-TRN-Sender", "_sender", message,
      [sender](const Value& value) { return value.string() != nullptr && *value.string() != *sender; },
      problems);
}

void checkEventMap(const std::string& map, const PostMessage& message, Problems& problems) {
  const size_t blank = map.find(' ');
  const auto method = parseNumber(std::string_view(map).substr(0, blank));
  const auto status =
      blank == std::string::npos ? std::nullopt : parseNumber(std::string_view(map).substr(blank + 1));
  if (!method || !status) {
    problems.add("header X-TRN-Event-Map: must be two whole numbers, but is \"" + printable(map, 80) + "\"");
    return;
  }
  const Dictionary* event = message.events.size() == 1 ? message.events[0].dictionary() : nullptr;
  const Value* eventMethod = event != nullptr ? event->find("_method") : nullptr;
  const Value* eventStatus = event != nullptr ? event->find("_status") : nullptr;
  if (eventMethod == nullptr || eventStatus == nullptr || eventMethod->uint64Value() != *method ||
      eventStatus->uint64Value() != *status) {
    problems.add("header X-TRN-Event-Map: is for a post of one event with this method and status");
  }
}

void checkBody(const NameValues& headers, const BodyFacts& body, Problems& problems) {
  const std::string* length = findHeader(headers, "Content-Length");
  if (length == nullptr) {
    problems.add("header Content-Length: missing");
  } else if (parseNumber(*length) != body.wireBytes) {
    problems.add("header Content-Length: says " + printable(*length, 40) + ", but " +
                 std::to_string(body.wireBytes) + " bytes came");
  }
  if (body.gzip && body.wireBytes >= body.plainBytes) {
    problems.add("body: gzip made it no shorter, so that it should have come as it is");
  }
}

}  // namespace

void Problems::add(std::string problem) {
  if (list_.size() + 1 < kLimit) {
    list_.push_back(std::move(problem));
  } else {
    ++more_;
  }
}

std::vector<std::string> Problems::take() {
  if (more_ > 0) list_.push_back("and " + std::to_string(more_) + " more");
  more_ = 0;
  return std::move(list_);
}

PostMessage readMessage(const Value& document, Problems& problems) {
  PostMessage message;
  const Dictionary* members = document.dictionary();
  if (members == nullptr) {
    problems.add("message: must be an object with postTime, clientId and events");
    return message;
  }
  if (const Value* time = members->find("postTime"); time == nullptr) {
    problems.add("postTime: missing");
  } else if (!isPlainNumber(*time)) {
    problems.add("postTime: must be a number");
  } else {
    message.postTime = *time;
  }
  if (members->size() == 1 && !message.postTime.isNull()) {
    problems.add("the message holds postTime only: its sender had no client identifier");
    return message;
  }
  if (const std::string* identifier = findString(*members, "clientId")) {
    message.clientId = *identifier;
  } else {
    problems.add(members->contains("clientId") ? "clientId: must be a text" : "clientId: missing");
  }
  if (const Array* events = findArray(*members, "events")) {
    message.events = *events;
    if (events->empty()) problems.add("events: empty");
  } else {
    problems.add(members->contains("events") ? "events: must be a list" : "events: missing");
  }
  for (const auto& [key, value] : *members) {
    if (key != "postTime" && key != "clientId" && key != "events") {
      problems.add("\"" + printable(key, 80) + "\": unknown in a message");
    }
  }
  return message;
}

void checkEvent(const Value& event, size_t number, Problems& problems) {
  const std::string place = "event " + std::to_string(number) + ": ";
  const Dictionary* fields = event.dictionary();
  if (fields == nullptr) {
    problems.add(place + "must be an object");
    return;
  }
  for (const FieldRule& rule : kFieldRules) {
    const Value* value = fields->find(rule.key);
    if (value == nullptr) {
      if (rule.required) problems.add(place + rule.key + ": missing");
    } else if (!rule.check(*value)) {
      problems.add(place + rule.key + ": must be " + rule.must);
    }
  }
  for (const auto& [key, value] : *fields) {
    if (const char* name = containerName(value)) {
      problems.add(place + printable(key, 80) + ": holds " + name +
                   ", where only texts and numbers may stand");
    }
  }
  const Value* clientTime = fields->find("_clientTS");
  const Value* eventTime = fields->find("eventTime");
  if (clientTime != nullptr && eventTime != nullptr && clientTime->isNumber() && eventTime->isNumber() &&
      clientTime->doubleValue() != eventTime->doubleValue()) {
    problems.add(place + "eventTime: differs from _clientTS");
  }
}

void checkHeaders(const NameValues& headers, const PostMessage& message, const BodyFacts& body,
                  Problems& problems) {
  if (const std::string* agent = findHeader(headers, "User-Agent")) {
    checkUserAgent(*agent, problems);
  } else {
    problems.add("header User-Agent: missing");
  }
  checkVersionHeader(headers, message, problems);
  checkSenderHeader(headers, message, problems);
  checkFixedHeader(headers, "Accept", problems);
  checkFixedHeader(headers, "Content-Type", problems);
  if (const std::string* internal = findHeader(headers, "X-TRN-Internal-Build");
      internal && *internal != "1") {
    problems.add("header X-TRN-Internal-Build: must be 1 or missing");
  }
  if (const std::string* map = findHeader(headers, "X-TRN-Event-Map")) checkEventMap(*map, message, problems);
  checkBody(headers, body, problems);
}

}  // namespace tarnel::lab
