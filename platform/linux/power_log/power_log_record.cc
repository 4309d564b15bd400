#include "platform/linux/power_log/power_log_record.h"

#include <sys/stat.h>

#include <cmath>

#include "formats/document.h"

namespace tarnel {

namespace {

constexpr double kMicroseconds = 1e6;

}  // namespace

std::string powerLogPayload(const Dictionary& dictionary, PowerLogRecord& record) {
  std::string text = writeTextDocument(dictionary);
  if (text.size() <= kMaxPowerLogPayload) {
    record.payload = dictionary;
    return text;
  }
  record.droppedBytes = text.size();
  return "";
}

std::string powerLogLine(const PowerLogRecord& record) {
  Dictionary line{{"time", static_cast<double>(record.microseconds) / kMicroseconds},
                  {"client", record.client},
                  {"event", record.eventName}};
  if (record.payload.isNull()) {
    line.set("dropped_bytes", record.droppedBytes);
  } else {
    line.set("payload", record.payload);
  }
  return writeTextDocument(line) + "\n";
}

std::optional<PowerLogRecord> powerLogRecord(std::string_view line) {
  const auto document = parseDocument(line);
  const Dictionary* entries = document ? document->dictionary() : nullptr;
  if (entries == nullptr) return std::nullopt;
  const Value* time = findNumber(*entries, "time");
  const Value* client = findNumber(*entries, "client");
  const std::string* event = findString(*entries, "event");
  const Dictionary* payload = findDictionary(*entries, "payload");
  const Value* dropped = findNumber(*entries, "dropped_bytes");
  if (time == nullptr || client == nullptr || event == nullptr) return std::nullopt;
  const double microseconds = std::round(time->doubleValue() * kMicroseconds);
  if (!(std::abs(microseconds) < 9e18)) return std::nullopt;
  return PowerLogRecord{.microseconds = static_cast<int64_t>(microseconds),
                        .client = client->int32Value(),
                        .eventName = *event,
                        .payload = payload == nullptr ? Value() : Value(*payload),
                        .droppedBytes = dropped == nullptr ? 0 : dropped->uint64Value()};
}

std::string powerLogFile(const Directories& directories, const std::string& journalSocket) {
  struct stat status {};
  if (!directories.isPrivate() && ::stat(journalSocket.c_str(), &status) == 0) return "";
  return directories.logs() + "/power.ndjson";
}

std::string olderPowerLogFile(const std::string& file) {
  return file + ".1";
}

}  // namespace tarnel
