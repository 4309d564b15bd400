#include "platform/linux/system/tarnel_logging.h"

#include <poll.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <utility>

#include "base/log_text.h"

namespace tarnel {

namespace {

// As much as fits into any pipe or socket that says it can take something.
constexpr size_t kMaxWrite = 4096;
constexpr int kWaitMilliseconds = 1000;

struct Facility {
  std::string_view name;
  int number;
};
constexpr std::array kFacilities{Facility{"Daemon", LOG_DAEMON}, Facility{"User", LOG_USER},
                                 Facility{"Auth", LOG_AUTH}, Facility{"Syslog", LOG_SYSLOG}};

int facilityNumber(std::string_view name) {
  for (const Facility& facility : kFacilities) {
    if (facility.name == name) return facility.number;
  }
  return LOG_USER;
}

bool isConnectedToJournal(const TarnelLogging::Environment& environment) {
  struct stat status {};
  if (environment.journalStream.empty() || ::fstat(environment.standardError, &status) != 0) return false;
  return environment.journalStream == std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino);
}

const char* variable(const char* name) {
  const char* text = std::getenv(name);
  return text == nullptr ? "" : text;
}

}  // namespace

TarnelLogging::Environment TarnelLogging::Environment::ofProcess() {
  return {.standardError = STDERR_FILENO,
          .journalStream = variable("JOURNAL_STREAM"),
          .level = variable("TARNEL_LOG_LEVEL")};
}

std::shared_ptr<TarnelLogging> TarnelLogging::startLogging(std::string_view processName,
                                                           std::string_view facility) {
  return startLogging(processName, facility, Environment::ofProcess());
}

std::shared_ptr<TarnelLogging> TarnelLogging::startLogging(std::string_view processName,
                                                           std::string_view facility,
                                                           const Environment& environment) {
  return std::shared_ptr<TarnelLogging>(
      new TarnelLogging(std::string(processName), facilityNumber(facility), environment));
}

TarnelLogging::TarnelLogging(std::string processName, int facility, const Environment& environment)
    : processName_(std::move(processName)),
      facility_(facility),
      standardError_(environment.standardError),
      journal_(isConnectedToJournal(environment)) {
  const auto level = logLevelFromText(environment.level);
  levelFromEnvironment_ = level.has_value();
  setActiveLevel(level.value_or(LogLevel::information));
  if (!level && !environment.level.empty()) {
    log(LogLevel::warning,
        "startLogging: TARNEL_LOG_LEVEL must be \"error\", \"warning\", \"information\" or \"debug\", not "
        "\"%s\"",
        environment.level.c_str());
  }
}

void TarnelLogging::setConfiguredLevel(std::optional<LogLevel> level) {
  if (!levelFromEnvironment_) setActiveLevel(level.value_or(LogLevel::information));
}

std::vector<std::string> TarnelLogging::journalFields(LogLevel level, std::string_view text) const {
  return {"MESSAGE=" + escapedForLog(text), "PRIORITY=" + std::to_string(static_cast<int>(level)),
          "SYSLOG_IDENTIFIER=" + processName_, "SYSLOG_FACILITY=" + std::to_string(LOG_FAC(facility_)),
          "SYSLOG_PID=" + std::to_string(::getpid())};
}

void TarnelLogging::write(LogLevel level, std::string_view text) {
  if (stopped_.load()) return;
  if (journal_) {
    std::vector<std::string> fields = journalFields(level, text);
    std::vector<iovec> parts;
    parts.reserve(fields.size());
    for (std::string& field : fields) parts.push_back({.iov_base = field.data(), .iov_len = field.size()});
    if (::sd_journal_sendv(parts.data(), static_cast<int>(parts.size())) >= 0) return;
  }
  std::string line = "<" + std::to_string(static_cast<int>(level)) + ">" + processName_ + "[" +
                     std::to_string(::getpid()) + "]: " + escapedForLog(text) + "\n";
  const std::lock_guard guard(mutex_);
  if (lost_ != 0) {
    line = "<4>" + processName_ + "[" + std::to_string(::getpid()) + "]: " + std::to_string(lost_) +
           " lines of this log were lost, because nobody read them\n" + line;
  }
  // What follows a line that was cut off must not look like its end.
  if (midLine_) line.insert(line.begin(), '\n');
  lost_ = writeLine(line) ? 0 : lost_ + 1;
}

bool TarnelLogging::writeLine(std::string_view line) {
  while (!line.empty()) {
    pollfd entry{.fd = standardError_, .events = POLLOUT, .revents = 0};
    // While lines are being lost, the next one does not wait again.
    const int ready = ::poll(&entry, 1, lost_ == 0 ? kWaitMilliseconds : 0);
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return false;
    const ssize_t count = ::write(standardError_, line.data(), std::min(line.size(), kMaxWrite));
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) return false;
    line.remove_prefix(static_cast<size_t>(count));
    midLine_ = !line.empty();
  }
  return true;
}

}  // namespace tarnel
