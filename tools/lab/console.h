#pragma once

#include <cstdio>
#include <string>

#include "platform/clock.h"
#include "tools/lab/print_queue.h"
#include "tools/receiving/arrival.h"
#include "tools/receiving/notices.h"

namespace tarnel::lab {

enum class ConsoleStyle { text, json, quiet };

// Prints what happens: arrivals and served storebags to the output, a readable line each (or one JSON object
// each); warnings to the error output. With ConsoleStyle::quiet only warnings. Nobody waits for the printing,
// but for flush() and the destructor. Threads: any.
class Console final : public ArrivalObserver, public Notices {
 public:
  // Streams and clock outlive the console. colour: only for terminals.
  Console(std::FILE* output, std::FILE* errors, ConsoleStyle style, bool colour, Clock& clock);

  void arrived(const Arrival& arrival) override;
  void uploadArrived(const UploadArrival& arrival) override;
  void logDataArrived(const LogDataArrival& arrival) override;
  void datagramArrived(const DatagramArrival& arrival) override;
  void storebagServed(const ServedStorebag& served) override;
  void warning(const std::string& text) override;

  // Where the lab listens and what to do with it: text for people, the status with ConsoleStyle::json.
  void started(const std::string& text, const Dictionary& status);
  void ended(const std::string& text);
  // Returns when all has been printed.
  void flush() { queue_.flush(); }

 private:
  enum class Tint { plain, dim, good, bad };

  std::string tinted(Tint tint, const std::string& text) const;
  std::string verdict(const std::vector<std::string>& problems) const;
  std::string problemLines(const std::vector<std::string>& problems) const;
  void printPost(const HttpArrival& arrival, const std::string& summary);
  void print(std::FILE* stream, std::string text) { queue_.print({stream, std::move(text)}); }
  PrintQueue::Text warningText(const std::string& text) const;
  void printRecord(const char* kind, const Dictionary& record);

  std::FILE* const output_;
  std::FILE* const errors_;
  const ConsoleStyle style_;
  const bool colour_;
  Clock& clock_;
  PrintQueue queue_;
};

}  // namespace tarnel::lab
