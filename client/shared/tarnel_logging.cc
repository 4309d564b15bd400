#include "client/shared/tarnel_logging.h"

#include <poll.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <utility>

#include "platform/base/value.h"

namespace tarnel {

namespace {

constexpr size_t kMaxText = 16384;
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

// Length of the well-formed UTF-8 sequence at the front; 0 when there is none.
size_t sequenceLength(std::string_view text) {
  for (size_t length = 1; length <= 4 && length <= text.size(); ++length) {
    if (isValidUtf8(text.substr(0, length))) return length;
  }
  return 0;
}

void appendEscape(std::string& out, char character) {
  switch (character) {
    case '\n':
      out += "\\n";
      return;
    case '\r':
      out += "\\r";
      return;
    case '\t':
      out += "\\t";
      return;
    default:
      std::array<char, 8> escape{};
      std::snprintf(escape.data(), escape.size(), "\\x%02x", static_cast<unsigned char>(character));
      out += escape.data();
  }
}

// Terminals obey the control characters U+0080 to U+009F as well.
bool isControl(std::string_view sequence) {
  const auto first = static_cast<unsigned char>(sequence[0]);
  if (sequence.size() == 1) return first < 0x20 || first == 0x7F;
  return sequence.size() == 2 && first == 0xC2 && static_cast<unsigned char>(sequence[1]) < 0xA0;
}

}  // namespace

std::string escapedForLog(std::string_view text) {
  if (text.ends_with('\n')) text.remove_suffix(1);
  const size_t cut = text.size() > kMaxText ? text.size() - kMaxText : 0;
  text = text.substr(0, kMaxText);
  std::string out;
  out.reserve(text.size());
  while (!text.empty()) {
    const size_t length = sequenceLength(text);
    const std::string_view sequence = text.substr(0, length == 0 ? 1 : length);
    if (length == 0 || isControl(sequence)) {
      for (const char character : sequence) appendEscape(out, character);
    } else {
      out += sequence;
    }
    text.remove_prefix(sequence.size());
  }
  if (cut != 0) out += " [" + std::to_string(cut) + " bytes more]";
  return out;
}

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
