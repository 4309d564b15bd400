#include "tools/receiving/arrival.h"

#include <map>

#include "base/hex.h"

namespace tarnel::lab {
namespace {

Dictionary headersOf(const HttpArrival& arrival) {
  Dictionary headers;
  headers.reserve(arrival.headers.size());
  for (const auto& [name, value] : arrival.headers) headers.set(name, value);
  return headers;
}

Dictionary commonRecord(const char* kind, const HttpArrival& arrival) {
  return {{kind, arrival.number}, {"arrived", arrival.arrived}, {"path", arrival.path}};
}

void addSender(const HttpArrival& arrival, Dictionary& record) {
  record.set("sender", arrival.sender);
  record.set("answered", arrival.answered);
}

void setIfPresent(Dictionary& record, const char* key, const MaybeString& value) {
  if (value) record.set(key, *value);
}

void addContent(const DashboardDatagram& content, Dictionary& record) {
  Array entries;
  for (const auto& [key, value] : content.entries) entries.append(Dictionary{{"key", key}, {"value", value}});
  record.merge({{"clientType", content.clientType},
                {"time", content.time},
                {"sessionID", content.sessionID},
                {"clientVersion", content.clientVersion},
                {"method", content.method},
                {"status", content.status},
                {"device", content.device},
                {"event", content.event},
                {"reportVersion", content.reportVersion},
                {"reliable", content.isReliable},
                {"serverFromStorebag", content.isServerFromStorebag},
                {"text", content.text},
                {"entries", entries}});
}

void addMessage(const Arrival& arrival, Dictionary& record) {
  record.set("headers", headersOf(arrival));
  if (arrival.clientId) record.set("clientId", *arrival.clientId);
  if (!arrival.postTime.isNull()) record.set("postTime", arrival.postTime);
}

}  // namespace

std::string_view nameOf(DatagramAnswer answer) {
  switch (answer) {
    case DatagramAnswer::nothing:
      return "nothing";
    case DatagramAnswer::acknowledged:
      return "acknowledged";
    case DatagramAnswer::dropped:
      return "dropped";
    case DatagramAnswer::acknowledgementDropped:
      return "acknowledgement dropped";
  }
  return "";
}

Array listOf(const std::vector<std::string>& problems) {
  Array list;
  for (const std::string& problem : problems) list.append(problem);
  return list;
}

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
  Dictionary record = commonRecord("post", arrival);
  addSender(arrival, record);
  addMessage(arrival, record);
  record.set("eventCount", arrival.events.size());
  record.set("methods", methodCounts(arrival.events));
  record.set("wireBytes", arrival.wireBytes);
  record.set("plainBytes", arrival.plainBytes);
  record.set("gzip", arrival.gzip);
  record.set("problems", listOf(arrival.problems));
  if (withEvents) record.set("events", arrival.events);
  return record;
}

Dictionary recordOfEvent(const Arrival& arrival, const Value& event) {
  Dictionary record = commonRecord("post", arrival);
  addMessage(arrival, record);
  record.set("event", event);
  return record;
}

Dictionary recordOfUpload(const UploadArrival& arrival) {
  Dictionary record = commonRecord("upload", arrival);
  addSender(arrival, record);
  record.set("headers", headersOf(arrival));
  setIfPresent(record, "uuid", arrival.query.uuid);
  setIfPresent(record, "sequence", arrival.query.sequence);
  setIfPresent(record, "description", arrival.query.description);
  setIfPresent(record, "filename", arrival.query.filename);
  setIfPresent(record, "raw", arrival.query.raw);
  if (!arrival.file.empty()) record.set("file", arrival.file);
  record.set("wireBytes", arrival.wireBytes);
  record.set("plainBytes", arrival.plainBytes);
  record.set("gzip", arrival.gzip);
  record.set("problems", listOf(arrival.problems));
  return record;
}

Dictionary recordOfLogData(const LogDataArrival& arrival, bool withRecords) {
  Dictionary record = commonRecord("logData", arrival);
  addSender(arrival, record);
  record.set("headers", headersOf(arrival));
  if (!arrival.location.empty()) record.set("location", arrival.location);
  if (!arrival.archiveFile.empty()) record.set("archiveFile", arrival.archiveFile);
  if (!arrival.recordsFile.empty()) record.set("recordsFile", arrival.recordsFile);
  record.set("recordCount", arrival.records.size());
  record.set("wireBytes", arrival.wireBytes);
  record.set("problems", listOf(arrival.problems));
  if (withRecords) record.set("records", arrival.records);
  return record;
}

Dictionary recordOfDatagram(const DatagramArrival& arrival) {
  Dictionary record = {{"datagram", arrival.number},       {"arrived", arrival.arrived},
                       {"sender", arrival.sender},         {"answered", std::string(nameOf(arrival.answer))},
                       {"repetition", arrival.repetition}, {"size", arrival.size}};
  if (arrival.content) {
    addContent(*arrival.content, record);
  } else {
    record.set("bytes", hexText(arrival.bytes));
  }
  record.set("problems", listOf(arrival.problems));
  return record;
}

}  // namespace tarnel::lab
