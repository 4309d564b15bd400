#include "base/log.h"

#include <array>
#include <cstdio>
#include <string>

namespace tarnel {

std::optional<LogLevel> logLevelFromText(std::string_view text) {
  if (text == "error" || text == "3") return LogLevel::error;
  if (text == "warning" || text == "4") return LogLevel::warning;
  if (text == "information" || text == "6") return LogLevel::information;
  if (text == "debug" || text == "7") return LogLevel::debug;
  return std::nullopt;
}

void Log::log(LogLevel level, const char* format, ...) {
  if (!enabled(level)) return;
  std::va_list arguments;
  va_start(arguments, format);
  logv(level, format, arguments);
  va_end(arguments);
}

void Log::logv(LogLevel level, const char* format, std::va_list arguments) {
  if (!enabled(level)) return;
  std::array<char, 512> small;  // most texts are shorter; filled by vsnprintf
  std::va_list again;
  va_copy(again, arguments);
  const int length = std::vsnprintf(small.data(), small.size(), format, arguments);
  if (length >= 0 && static_cast<size_t>(length) < small.size()) {
    write(level, std::string_view(small.data(), static_cast<size_t>(length)));
  } else if (length >= 0) {
    std::string large(static_cast<size_t>(length) + 1, '\0');
    std::vsnprintf(large.data(), large.size(), format, again);
    large.pop_back();
    write(level, large);
  }
  va_end(again);
}

}  // namespace tarnel
