#include "tools/lab/console.h"

#include "platform/document.h"
#include "tools/lab/text.h"

namespace tarnel::lab {
namespace {

constexpr size_t kMaxMethodsShown = 8;

std::string headerOr(const Arrival& arrival, const char* name, const char* otherwise) {
  const std::string* value = findHeader(arrival.headers, name);
  return value == nullptr || value->empty() ? otherwise : printable(*value, 40);
}

std::string methodsText(const Array& events) {
  const Dictionary counts = methodCounts(events);
  std::string text;
  size_t shown = 0;
  for (const auto& [method, count] : counts) {
    if (++shown > kMaxMethodsShown) return text + ", ...";
    text += (text.empty() ? "" : ", ") + method;
    if (count.int64Value() != 1) text += " x" + std::to_string(count.int64Value());
  }
  return text;
}

}  // namespace

std::string summaryOf(const Arrival& arrival) {
  std::string text = headerOr(arrival, "X-TRN-Sender", "unknown sender");
  const std::string client = headerOr(arrival, "X-TRN-Client-Name", "");
  const std::string service = headerOr(arrival, "X-TRN-Service-Name", "");
  if (!client.empty() || !service.empty()) {
    text += "  " + client + (client.empty() || service.empty() ? "" : " / ") + service;
  }
  text += "  " + grouped(arrival.events.size()) + (arrival.events.size() == 1 ? " event" : " events");
  if (const std::string methods = methodsText(arrival.events); !methods.empty())
    text += " (method " + methods + ")";
  text += "  " + byteCount(arrival.wireBytes);
  if (arrival.gzip) text += arrival.plainBytes == 0 ? " gzip" : " gzip of " + byteCount(arrival.plainBytes);
  return text;
}

Console::Console(std::FILE* output, std::FILE* errors, ConsoleStyle style, bool colour, Clock& clock)
    : output_(output), errors_(errors), style_(style), colour_(colour), clock_(clock) {}

std::string Console::tinted(Tint tint, const std::string& text) const {
  if (!colour_ || tint == Tint::plain) return text;
  const char* code = tint == Tint::dim ? "\033[2m" : (tint == Tint::good ? "\033[32m" : "\033[31m");
  return code + text + "\033[0m";
}

void Console::print(std::FILE* stream, const std::string& text) {
  const std::lock_guard lock(mutex_);
  std::fwrite(text.data(), 1, text.size(), stream);
  std::fflush(stream);
}

void Console::printRecord(const char* kind, Dictionary record) {
  Dictionary line = {{"kind", kind}};
  line.merge(record);
  print(output_, writeTextDocument(line) + "\n");
}

void Console::arrived(const Arrival& arrival) {
  if (style_ == ConsoleStyle::quiet) return;
  if (style_ == ConsoleStyle::json) return printRecord("post", recordOfPost(arrival, true));
  const bool good = arrival.problems.empty();
  std::string text = tinted(Tint::dim, clockTime(arrival.arrived)) + "  POST " + arrival.path + "  " +
                     summaryOf(arrival) + "  ";
  text += good ? tinted(Tint::good, "ok")
               : tinted(Tint::bad, std::to_string(arrival.problems.size()) +
                                       (arrival.problems.size() == 1 ? " problem" : " problems"));
  if (arrival.answered != "200") text += "  " + tinted(Tint::bad, "answered: " + arrival.answered);
  text += "\n";
  for (const std::string& problem : arrival.problems) {
    text += "              " + tinted(Tint::bad, "! ") + printable(problem, 300) + "\n";
  }
  print(output_, text);
}

void Console::storebagServed(const ServedStorebag& served) {
  if (style_ == ConsoleStyle::quiet) return;
  if (style_ == ConsoleStyle::json) {
    return printRecord("storebag", {{"time", served.time},
                                    {"sender", served.sender},
                                    {"name", printable(served.name)},
                                    {"version", served.version},
                                    {"status", served.status},
                                    {"bytes", served.bytes},
                                    {"remark", served.remark}});
  }
  std::string text =
      tinted(Tint::dim, clockTime(served.time)) + "  GET  storebag " + printable(served.name, 64);
  if (!served.version.empty()) text += "  version " + printable(served.version, 40);
  if (served.status == 200) text += "  " + byteCount(served.bytes);
  if (served.status == 304) text += "  not modified";
  if (served.status >= 400) text += "  " + tinted(Tint::bad, std::to_string(served.status));
  if (!served.remark.empty()) text += "  " + tinted(Tint::bad, printable(served.remark));
  print(output_, text + "\n");
}

void Console::warning(const std::string& text) {
  const double now = secondsFromTimeValue(clock_.timeOfDay());
  if (style_ == ConsoleStyle::json) return printRecord("warning", {{"time", now}, {"text", text}});
  print(errors_,
        tinted(Tint::dim, clockTime(now)) + "  " + tinted(Tint::bad, "warning") + "  " + text + "\n");
}

void Console::started(const std::string& text, const Dictionary& status) {
  if (style_ == ConsoleStyle::json) return printRecord("started", status);
  if (style_ == ConsoleStyle::text) print(output_, text);
}

void Console::ended(const std::string& text) {
  if (style_ == ConsoleStyle::json) return printRecord("ended", {{"text", text}});
  if (style_ == ConsoleStyle::text) print(output_, text + "\n");
}

}  // namespace tarnel::lab
