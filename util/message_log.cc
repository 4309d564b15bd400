#include "util/message_log.h"

#include <charconv>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <string>
#include <string_view>
#include <utility>

namespace tarnel {
namespace {

constexpr double kExpirySeconds = 86400;
constexpr std::string_view kNameBegin = "tarneld_";
constexpr std::string_view kNameEnd = "_messageLog.diag";

struct LogFile {
  std::string path;
  std::optional<Date> created;
};

std::string dateText(const std::optional<Date>& date) {
  return date ? description(*date) : "(null)";
}

// What stands between the two parts that every name has, if it has exactly three; it may be anything.
std::optional<std::string_view> middlePart(std::string_view name) {
  if (name.size() < kNameBegin.size() + kNameEnd.size()) return std::nullopt;
  if (!name.starts_with(kNameBegin) || !name.ends_with(kNameEnd)) return std::nullopt;
  name.remove_prefix(kNameBegin.size());
  name.remove_suffix(kNameEnd.size());
  return name.find('_') == std::string_view::npos ? std::optional(name) : std::nullopt;
}

// The time that a file was given with its name. Names have the low 32 bits of the seconds; of the times that
// could be meant it is the one closest to now.
std::optional<Date> dateFromName(std::string_view middle, int64_t now) {
  int32_t low = 0;
  const auto* end = middle.data() + middle.size();
  const auto parsed = std::from_chars(middle.data(), end, low);
  if (parsed.ec != std::errc() || parsed.ptr != end) return std::nullopt;
  const auto age = static_cast<int32_t>(now - low);  // keeps the low 32 bits, as the name did
  return Date{static_cast<double>(now - age)};
}

// Not every file system knows when a file was made.
std::optional<Date> creationDate(const Dependencies& dependencies, const std::string& path,
                                 std::string_view middle, int64_t now) {
  const auto date = dependencies.files.creationDate(path);
  return date ? date : dateFromName(middle, now);
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
std::optional<LogFile> usableLogFile(const Dependencies& dependencies, const TimeValue& now) {
  std::optional<LogFile> kept;
  for (const auto& name : directoryEntries(dependencies)) {
    const auto middle = middlePart(name);
    if (!middle) continue;
    LogFile file{dependencies.messageLogDirectory + "/" + name, std::nullopt};
    file.created = creationDate(dependencies, file.path, *middle, now.seconds);
    if (file.created && secondsFromTimeValue(now) - file.created->seconds > kExpirySeconds) {
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
  const std::string middle = std::to_string(static_cast<int32_t>(now));
  LogFile file{dependencies.messageLogDirectory + "/", std::nullopt};
  file.path.append(kNameBegin).append(middle).append(kNameEnd);
  // Whether the file is there counts, not who made it.
  static_cast<void>(dependencies.files.createFile(file.path));
  if (!dependencies.files.fileExists(file.path)) {
    TARNEL_LOG(dependencies.log, error, "writeToLogFile: Failed to create new tarneld log file %s",
               file.path.c_str());
    return std::nullopt;
  }
  file.created = creationDate(dependencies, file.path, middle, now);
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
  auto file = usableLogFile(dependencies, now);
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
