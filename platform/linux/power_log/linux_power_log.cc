#include "platform/linux/power_log/linux_power_log.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <system_error>
#include <utility>
#include <vector>

#include "base/file_access.h"
#include "base/unique_fd.h"
#include "platform/file_system.h"

namespace tarnel {

LinuxPowerLog::LinuxPowerLog(Options options, Clock& clock, Log& log)
    : options_(std::move(options)), clock_(clock), losses_("logRegisteredEvent", log) {}

int LinuxPowerLog::sendToJournal(const iovec* fields, int count) {
  return ::sd_journal_sendv(fields, count);
}

void LinuxPowerLog::logRegisteredEvent(int32_t client, const std::string& eventName,
                                       const Dictionary& dictionary, const MaybeDictionary& /*extra*/) {
  const TimeValue now = clock_.timeOfDay();
  PowerLogRecord record{
      .microseconds = now.seconds * 1'000'000 + now.microseconds, .client = client, .eventName = eventName};
  const std::string payload = powerLogPayload(dictionary, record);
  const auto error =
      options_.file.empty() ? writeToJournal(record, payload) : writeToFile(powerLogLine(record));
  std::vector<ConfigurationProblem> problems;
  if (error) {
    problems.push_back(
        {LogLevel::error, error->localizedDescription() + "; events of the power log are lost"});
  }
  losses_.report(problems);
}

MaybeError LinuxPowerLog::writeToJournal(const PowerLogRecord& record, const std::string& payload) const {
  std::vector<std::string> fields{
      "MESSAGE=Power event " + record.eventName + " of client " + std::to_string(record.client),
      std::string("MESSAGE_ID=") + kPowerLogMessageID,
      "PRIORITY=6",
      "SYSLOG_IDENTIFIER=tarneld",
      std::string(kPowerLogClientField) + "=" + std::to_string(record.client),
      std::string(kPowerLogEventField) + "=" + record.eventName,
      record.payload.isNull() ? std::string(kPowerLogDroppedField) + "=" + std::to_string(record.droppedBytes)
                              : std::string(kPowerLogPayloadField) + "=" + payload};
  std::vector<iovec> parts;
  parts.reserve(fields.size());
  for (std::string& field : fields) parts.push_back({.iov_base = field.data(), .iov_len = field.size()});
  const int result = options_.send(parts.data(), static_cast<int>(parts.size()));
  if (result >= 0) return std::nullopt;
  return Error(
      kFileErrorDomain, -result,
      "the journal takes no records: " + std::error_code(-result, std::generic_category()).message());
}

MaybeError LinuxPowerLog::writeToFile(const std::string& line) {
  const std::string& path = options_.file;
  const std::lock_guard guard(mutex_);
  UniqueFd fd;
  struct stat status {};
  const auto open = [&fd, &status, &path] {
    fd = UniqueFd(
        ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0600));
    return fd && ::fstat(fd.get(), &status) == 0;
  };
  if (!open()) return systemError(path, "cannot be opened");
  if (!S_ISREG(status.st_mode)) return Error(kFileErrorDomain, EINVAL, path + ": is not a regular file");
  if (status.st_size > 0 && static_cast<size_t>(status.st_size) + line.size() > options_.maxFileBytes) {
    if (::rename(path.c_str(), olderPowerLogFile(path).c_str()) != 0)
      return systemError(path, "cannot be renamed");
    if (!open()) return systemError(path, "cannot be opened");
  }
  const ssize_t written = ::write(fd.get(), line.data(), line.size());
  if (written == static_cast<ssize_t>(line.size())) return std::nullopt;
  if (written >= 0) errno = ENOSPC;
  auto error = systemError(path, "cannot be written");
  // A part of a line would spoil the next one.
  if (written > 0 && ::ftruncate(fd.get(), status.st_size) != 0) return systemError(path, "cannot be cut");
  return error;
}

}  // namespace tarnel
