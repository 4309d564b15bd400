#include "tools/lab/console.h"

#include "formats/document.h"
#include "tools/lab/summary.h"
#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

std::string recordLine(const char* kind, const Dictionary& record) {
  Dictionary line = {{"kind", kind}};
  line.merge(record);
  return writeTextDocument(line) + "\n";
}

}  // namespace

Console::Console(std::FILE* output, std::FILE* errors, ConsoleStyle style, bool colour, Clock& clock)
    : output_(output),
      errors_(errors),
      style_(style),
      colour_(colour),
      clock_(clock),
      queue_([this](uint64_t lost) {
        return warningText("lines that the output did not take, and that are lost: " + grouped(lost) +
                           "; what arrived is in the files");
      }) {}

std::string Console::tinted(Tint tint, const std::string& text) const {
  if (!colour_ || tint == Tint::plain) return text;
  const char* code = tint == Tint::dim ? "\033[2m" : (tint == Tint::good ? "\033[32m" : "\033[31m");
  return code + text + "\033[0m";
}

void Console::printRecord(const char* kind, const Dictionary& record) {
  print(output_, recordLine(kind, record));
}

void Console::arrived(const Arrival& arrival) {
  if (style_ == ConsoleStyle::quiet) return;
  if (style_ == ConsoleStyle::json) return printRecord("post", recordOfPost(arrival, true));
  printPost(arrival, summaryOf(arrival));
}

void Console::uploadArrived(const UploadArrival& arrival) {
  if (style_ == ConsoleStyle::quiet) return;
  if (style_ == ConsoleStyle::json) return printRecord("upload", recordOfUpload(arrival));
  printPost(arrival, summaryOf(arrival));
}

void Console::logDataArrived(const LogDataArrival& arrival) {
  if (style_ == ConsoleStyle::quiet) return;
  if (style_ == ConsoleStyle::json) return printRecord("logData", recordOfLogData(arrival, true));
  printPost(arrival, summaryOf(arrival));
}

void Console::datagramArrived(const DatagramArrival& arrival) {
  if (style_ == ConsoleStyle::quiet) return;
  if (style_ == ConsoleStyle::json) return printRecord("datagram", recordOfDatagram(arrival));
  std::string text = tinted(Tint::dim, clockTime(arrival.arrived)) + "  UDP  " + arrival.sender + "  " +
                     summaryOf(arrival) + "  " + verdict(arrival.problems);
  if (arrival.answer != DatagramAnswer::nothing) {
    const bool good = arrival.answer == DatagramAnswer::acknowledged;
    text += "  " + tinted(good ? Tint::plain : Tint::bad, std::string(nameOf(arrival.answer)));
  }
  print(output_, text + "\n" + problemLines(arrival.problems));
}

std::string Console::verdict(const std::vector<std::string>& problems) const {
  if (problems.empty()) return tinted(Tint::good, "ok");
  return tinted(Tint::bad,
                std::to_string(problems.size()) + (problems.size() == 1 ? " problem" : " problems"));
}

std::string Console::problemLines(const std::vector<std::string>& problems) const {
  std::string text;
  for (const std::string& problem : problems) {
    text += "              " + tinted(Tint::bad, "! ") + printable(problem, 300) + "\n";
  }
  return text;
}

void Console::printPost(const HttpArrival& arrival, const std::string& summary) {
  std::string text = tinted(Tint::dim, clockTime(arrival.arrived)) + "  POST " + arrival.path + "  " +
                     summary + "  " + verdict(arrival.problems);
  if (arrival.answered != "200") text += "  " + tinted(Tint::bad, "answered: " + arrival.answered);
  print(output_, text + "\n" + problemLines(arrival.problems));
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

PrintQueue::Text Console::warningText(const std::string& text) const {
  const double now = secondsFromTimeValue(clock_.timeOfDay());
  if (style_ == ConsoleStyle::json) return {output_, recordLine("warning", {{"time", now}, {"text", text}})};
  return {errors_,
          tinted(Tint::dim, clockTime(now)) + "  " + tinted(Tint::bad, "warning") + "  " + text + "\n"};
}

void Console::warning(const std::string& text) {
  queue_.print(warningText(text));
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
