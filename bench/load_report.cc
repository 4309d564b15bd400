#include "bench/load_report.h"

#include <cstdio>

#include "formats/json_writer.h"

namespace tarnel::bench {
namespace {

double perIdle(int64_t before, int64_t after, size_t idle) {
  return static_cast<double>(after - before) / static_cast<double>(idle);
}

Dictionary memoryOf(const ProcessMemory& memory) {
  return {{"residentKb", memory.resident}, {"ownKb", memory.own}, {"threads", memory.threads}};
}

Dictionary asDictionary(const LoadReport& report, const LoadOptions& options) {
  Dictionary out;
  out.set("start", memoryOf(report.start));
  const auto addIdle = [&](const char* key, const std::optional<ProcessMemory>& memory) {
    if (!memory) return;
    Dictionary held = memoryOf(*memory);
    held.set("residentKbPerConnection", perIdle(report.start.resident, memory->resident, options.idle));
    held.set("ownKbPerConnection", perIdle(report.start.own, memory->own, options.idle));
    out.set(key, held);
  };
  addIdle("idleConnected", report.connected);
  addIdle("idleConfigured", report.configured);
  if (report.messages == 0) return out;
  const auto messages = static_cast<double>(report.messages);
  out.set("messages", report.messages);
  out.set("seconds", report.seconds);
  out.set("messagesPerSecond", messages / report.seconds);
  out.set("daemonMicrosecondsPerMessage", report.cpuSeconds * 1e6 / messages);
  Array course;
  for (const auto& memory : report.course) course.append(memoryOf(memory));
  out.set("course", course);
  return out;
}

void append(std::string& out, const char* what, double number, const char* unit) {
  char line[128];
  std::snprintf(line, sizeof line, "%-44s %12.1f %s\n", what, number, unit);
  out += line;
}

}  // namespace

std::string describe(const LoadReport& report, const LoadOptions& options) {
  std::string out;
  if (options.json) {
    writeJson(asDictionary(report, options), JsonStyle::compact, out);
    return out + '\n';
  }
  append(out, "resident before", static_cast<double>(report.start.resident), "kB");
  if (report.connected) {
    append(out, "resident per connection, connected",
           perIdle(report.start.resident, report.connected->resident, options.idle), "kB");
  }
  if (report.configured) {
    append(out, "resident per connection, configured",
           perIdle(report.start.resident, report.configured->resident, options.idle), "kB");
  }
  if (report.messages == 0) return out;
  const auto messages = static_cast<double>(report.messages);
  append(out, "messages", messages, "");
  append(out, "messages per second", messages / report.seconds, "");
  append(out, "processor time of the daemon per message", report.cpuSeconds * 1e6 / messages, "us");
  append(out, "resident after the first tenth", static_cast<double>(report.course[1].resident), "kB");
  append(out, "resident at the end", static_cast<double>(report.course.back().resident), "kB");
  return out;
}

}  // namespace tarnel::bench
