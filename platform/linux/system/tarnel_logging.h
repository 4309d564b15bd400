#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/log.h"

namespace tarnel {

// The log of a process: the journal when the service manager connected standard error to it, else standard
// error itself with "<N>" before each line, which a service manager reads as the line's priority.
//
// A text takes one line, whatever it holds (see escapedForLog).
// A reader that does not read delays a line by at most a second; then it is lost, and the next line that can
// be written is preceded by the count of lost ones.
//
// Writing to a pipe that nobody reads raises SIGPIPE; a daemon ignores that signal.
//
// Threads: any.
class TarnelLogging final : public Log {
 public:
  // What the process was started with, for tests.
  struct Environment {
    int standardError = 2;      // a descriptor, not owned
    std::string journalStream;  // JOURNAL_STREAM: "<device>:<inode>", or empty
    std::string level;          // TARNEL_LOG_LEVEL, or empty
    static Environment ofProcess();
  };

  // startLogging:facility:
  // Opens the log connection under the process's name. `facility` is a syslog facility by name ("Daemon",
  // "User"); an unknown one counts as "User". Texts up to level 6 are written, or what TARNEL_LOG_LEVEL says.
  static std::shared_ptr<TarnelLogging> startLogging(std::string_view processName, std::string_view facility);
  static std::shared_ptr<TarnelLogging> startLogging(std::string_view processName, std::string_view facility,
                                                     const Environment& environment);

  // Closes the log connection; what is logged afterwards is dropped.
  void stopLogging() { stopped_.store(true); }

  // The level of the configuration; TARNEL_LOG_LEVEL wins over it.
  void setConfiguredLevel(std::optional<LogLevel> level);

  bool writesToJournal() const noexcept { return journal_; }
  // The journal's fields of one text: "NAME=value" each.
  std::vector<std::string> journalFields(LogLevel level, std::string_view text) const;

 protected:
  void write(LogLevel level, std::string_view text) override;

 private:
  TarnelLogging(std::string processName, int facility, const Environment& environment);
  bool writeLine(std::string_view line);

  const std::string processName_;
  const int facility_;
  const int standardError_;
  const bool journal_;
  bool levelFromEnvironment_ = false;
  std::atomic<bool> stopped_{false};
  std::mutex mutex_;
  uint64_t lost_ = 0;     // guarded by mutex_; lines since the last one that was written
  bool midLine_ = false;  // guarded by mutex_; the last line was written in part
};

}  // namespace tarnel
