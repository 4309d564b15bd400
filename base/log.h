#pragma once

#include <atomic>
#include <cstdarg>
#include <optional>
#include <string>
#include <string_view>

namespace tarnel {

// Syslog priorities; the four that the system uses.
enum class LogLevel : int { error = 3, warning = 4, information = 6, debug = 7 };

// "error", "warning", "information" or "debug", or the numbers 3, 4, 6 and 7; nothing for any other text.
std::optional<LogLevel> logLevelFromText(std::string_view text);

// Where diagnostics go. Texts are printf formats, checked by the compiler, and begin with the name of the
// routine that writes them.
//
// Threads: log() and enabled() may be called from any thread.
class Log {
 public:
  Log() = default;
  Log(const Log&) = delete;
  Log& operator=(const Log&) = delete;
  virtual ~Log() = default;

  // True when a text of this level would be written; false spares formatting it.
  bool enabled(LogLevel level) const noexcept {
    return static_cast<int>(level) <= activeLevel_.load(std::memory_order_relaxed);
  }
  // Texts above this level are dropped. Everything is written until somebody says otherwise.
  void setActiveLevel(LogLevel level) noexcept {
    activeLevel_.store(static_cast<int>(level), std::memory_order_relaxed);
  }

  __attribute__((format(printf, 3, 4))) void log(LogLevel level, const char* format, ...);
  void logv(LogLevel level, const char* format, std::va_list arguments);

 protected:
  // Writes one text, without a trailing newline of its own; called concurrently.
  virtual void write(LogLevel level, std::string_view text) = 0;

 private:
  std::atomic<int> activeLevel_{static_cast<int>(LogLevel::debug)};
};

// Formats and evaluates its arguments only when the level is active:
//   TARNEL_LOG(log, debug, "setSessionInfo: Configuring session %u", sessionID);
#define TARNEL_LOG(logger, level, ...)                      \
  do {                                                      \
    if ((logger).enabled(::tarnel::LogLevel::level)) {      \
      (logger).log(::tarnel::LogLevel::level, __VA_ARGS__); \
    }                                                       \
  } while (false)

// For %s: a missing text prints as "(null)".
inline const char* printable(const std::optional<std::string>& text) {
  return text ? text->c_str() : "(null)";
}
inline const char* printable(const std::string* text) {
  return text != nullptr ? text->c_str() : "(null)";
}

}  // namespace tarnel
