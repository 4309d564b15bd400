#include "util/message_log.h"

#include <array>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <string_view>
#include <utility>

namespace tarnel {
namespace {

constexpr double kExpirySeconds = 86400;
constexpr std::string_view kNameFirstPart = "tarneld";
constexpr std::string_view kNameLastPart = "messageLog.diag";

struct LogFile {
  std::string path;
  std::optional<Date> created;
};

std::string dateText(const std::optional<Date>& date) {
  return date ? description(*date) : "(null)";
}

// Three parts between underscores; the middle one may be anything.
bool isMessageLogName(std::string_view name) {
  const auto first = name.find('_');
  if (first == std::string_view::npos) return false;
  const auto second = name.find('_', first + 1);
  if (second == std::string_view::npos || name.find('_', second + 1) != std::string_view::npos) return false;
  return name.substr(0, first) == kNameFirstPart && name.substr(second + 1) == kNameLastPart;
}

std::vector<std::string> directoryEntries(const Dependencies& dependencies) {
  const auto& directory = dependencies.messageLogDirectory;
  auto entries = dependencies.files.contentsOfDirectory(directory);
  if (entries) return *std::move(entries);
  if (entries.error().code() == kFileReadNoSuchFileError) {
    TARNEL_LOG(dependencies.log, information, "writeToLogFile: Creating tarneld log directory at %s",
               directory.c_str());
    // What goes wrong here shows when the file is made.
    static_cast<void>(dependencies.files.createDirectory(directory));
  } else {
    TARNEL_LOG(dependencies.log, error, "writeToLogFile: Error reading from log directory: %s",
               entries.error().description().c_str());
  }
  return {};
}

void deleteLogFile(const Dependencies& dependencies, const LogFile& file) {
  if (const auto error = dependencies.files.removeFile(file.path)) {
    TARNEL_LOG(dependencies.log, error, "writeToLogFile: Failed to delete tarneld log file %s (%s)",
               file.path.c_str(), error->description().c_str());
    return;
  }
  TARNEL_LOG(dependencies.log, information, "writeToLogFile: Deleted expired tarneld log file %s (%s)",
             file.path.c_str(), dateText(file.created).c_str());
}

// The newest file that has not expired; the others are deleted.
std::optional<LogFile> usableLogFile(const Dependencies& dependencies, double now) {
  std::optional<LogFile> kept;
  for (const auto& name : directoryEntries(dependencies)) {
    if (!isMessageLogName(name)) continue;
    LogFile file{dependencies.messageLogDirectory + "/" + name, std::nullopt};
    file.created = dependencies.files.creationDate(file.path);
    if (file.created && now - file.created->seconds > kExpirySeconds) {
      deleteLogFile(dependencies, file);
    } else if (!kept || !kept->created) {  // one without a date gives way, but is not deleted
      kept = std::move(file);
    } else if (file.created && file.created->seconds > kept->created->seconds) {
      deleteLogFile(dependencies, *kept);
      kept = std::move(file);
    } else {
      deleteLogFile(dependencies, file);
    }
  }
  return kept;
}

std::optional<LogFile> newLogFile(const Dependencies& dependencies, int64_t now) {
  std::array<char, 64> name;
  std::snprintf(name.data(), name.size(), "%s_%d_%s", kNameFirstPart.data(), static_cast<int32_t>(now),
                kNameLastPart.data());
  LogFile file{dependencies.messageLogDirectory + "/" + name.data(), std::nullopt};
  // Whether the file is there counts, not who made it.
  static_cast<void>(dependencies.files.createFile(file.path));
  if (!dependencies.files.fileExists(file.path)) {
    TARNEL_LOG(dependencies.log, error, "writeToLogFile: Failed to create new tarneld log file %s",
               file.path.c_str());
    return std::nullopt;
  }
  file.created = dependencies.files.creationDate(file.path);
  TARNEL_LOG(dependencies.log, information, "writeToLogFile: Created new tarneld log file %s (%s)",
             file.path.c_str(), dateText(file.created).c_str());
  return file;
}

// Appends the formatted text, however long.
void appendFormatted(std::string& out, const char* format, std::va_list arguments) {
  std::va_list again;
  va_copy(again, arguments);
  const int length = std::vsnprintf(nullptr, 0, format, arguments);
  if (length > 0) {
    const size_t start = out.size();
    out.resize(start + static_cast<size_t>(length) + 1);
    std::vsnprintf(out.data() + start, static_cast<size_t>(length) + 1, format, again);
    out.pop_back();
  }
  va_end(again);
}

}  // namespace

void writeToLogFile(const Dependencies& dependencies, const char* format, ...) {
  const TimeValue now = dependencies.clock.timeOfDay();
  auto file = usableLogFile(dependencies, secondsFromTimeValue(now));
  if (!file) file = newLogFile(dependencies, now.seconds);
  if (!file) return;

  std::string line = "(" + description(Date{secondsFromTimeValue(now)}) + ") ";
  std::va_list arguments;
  va_start(arguments, format);
  appendFormatted(line, format, arguments);
  va_end(arguments);
  line += '\n';
  if (const auto error = dependencies.files.appendToFile(file->path, line)) {
    TARNEL_LOG(dependencies.log, warning, "writeToLogFile: Failed to write to tarneld log file %s (%s)",
               file->path.c_str(), error->description().c_str());
    deleteLogFile(dependencies, *file);
    return;
  }
  TARNEL_LOG(dependencies.log, information, "writeToLogFile: Saved log message to %s", file->path.c_str());
}

}  // namespace tarnel
