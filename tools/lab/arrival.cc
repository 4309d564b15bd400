#include "tools/lab/arrival.h"

#include <map>

namespace tarnel::lab {
namespace {

Dictionary headersOf(const Arrival& arrival) {
  Dictionary headers;
  headers.reserve(arrival.headers.size());
  for (const auto& [name, value] : arrival.headers) headers.set(name, value);
  return headers;
}

Dictionary commonRecord(const Arrival& arrival) {
  return {{"post", arrival.number}, {"arrived", arrival.arrived}, {"path", arrival.path}};
}

void addMessage(const Arrival& arrival, Dictionary& record) {
  record.set("headers", headersOf(arrival));
  if (arrival.clientId) record.set("clientId", *arrival.clientId);
  if (!arrival.postTime.isNull()) record.set("postTime", arrival.postTime);
}

}  // namespace

Dictionary methodCounts(const Array& events) {
  std::map<int64_t, uint64_t> counts;
  for (const Value& event : events) {
    const Dictionary* fields = event.dictionary();
    const Value* method = fields != nullptr ? findNumber(*fields, "_method") : nullptr;
    if (method != nullptr) ++counts[method->int64Value()];
  }
  Dictionary list;
  for (const auto& [method, count] : counts) list.set(std::to_string(method), count);
  return list;
}

Dictionary recordOfPost(const Arrival& arrival, bool withEvents) {
  Dictionary record = commonRecord(arrival);
  record.set("sender", arrival.sender);
  record.set("answered", arrival.answered);
  addMessage(arrival, record);
  record.set("eventCount", arrival.events.size());
  record.set("methods", methodCounts(arrival.events));
  record.set("wireBytes", arrival.wireBytes);
  record.set("plainBytes", arrival.plainBytes);
  record.set("gzip", arrival.gzip);
  Array problems;
  for (const std::string& problem : arrival.problems) problems.append(problem);
  record.set("problems", problems);
  if (withEvents) record.set("events", arrival.events);
  return record;
}

Dictionary recordOfEvent(const Arrival& arrival, const Value& event) {
  Dictionary record = commonRecord(arrival);
  addMessage(arrival, record);
  record.set("event", event);
  return record;
}

}  // namespace tarnel::lab
