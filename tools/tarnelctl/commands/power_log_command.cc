#include "tools/tarnelctl/commands/power_log_command.h"

#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <deque>
#include <ostream>
#include <string_view>

#include "base/unique_fd.h"
#include "formats/document.h"
#include "tools/tarnelctl/power_log_journal.h"

namespace tarnel::ctl {
namespace {

// The daemon writes shorter ones.
constexpr size_t kMaxLine = 1U << 20U;

std::string timeText(int64_t microseconds) {
  int64_t seconds = microseconds / 1'000'000;
  int64_t rest = microseconds % 1'000'000;
  if (rest < 0) {
    rest += 1'000'000;
    --seconds;
  }
  const time_t time = seconds;
  std::tm parts{};
  std::array<char, 64> text{};
  if (gmtime_r(&time, &parts) == nullptr ||
      std::strftime(text.data(), text.size(), "%Y-%m-%d %H:%M:%S", &parts) == 0) {
    return std::to_string(seconds);
  }
  std::array<char, 96> whole{};
  std::snprintf(whole.data(), whole.size(), "%s.%06d +0000", text.data(), static_cast<int>(rest));
  return whole.data();
}

// Reads what is added to one file, line by line.
class LineReader {
 public:
  explicit LineReader(const std::string& path)
      : fd_(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY)), error_(fd_ ? 0 : errno) {
    struct stat status {};
    if (!fd_ || ::fstat(fd_.get(), &status) != 0 || !S_ISDIR(status.st_mode)) return;
    error_ = EISDIR;
    fd_ = UniqueFd();
  }
  explicit operator bool() const { return static_cast<bool>(fd_); }
  // Why there is none.
  int error() const { return error_; }

  template <class Take>
  void readLines(const Take& take) {
    std::array<char, 65536> buffer;  // filled by read
    for (;;) {
      const ssize_t count = ::read(fd_.get(), buffer.data(), buffer.size());
      if (count < 0 && errno == EINTR) continue;
      if (count <= 0) return;
      line_.append(buffer.data(), static_cast<size_t>(count));
      size_t start = 0;
      for (size_t end = line_.find('\n'); end != std::string::npos; end = line_.find('\n', start)) {
        take(std::string_view(line_).substr(start, end - start));
        start = end + 1;
      }
      line_.erase(0, start);
      if (line_.size() > kMaxLine) line_.clear();
    }
  }
  // Whether the path now leads to another file, or to none.
  bool isReplaced(const std::string& path) const {
    struct stat mine {};
    struct stat there {};
    if (!fd_ || ::fstat(fd_.get(), &mine) != 0) return true;
    return ::stat(path.c_str(), &there) != 0 || mine.st_ino != there.st_ino || mine.st_dev != there.st_dev;
  }

 private:
  UniqueFd fd_;
  int error_;
  std::string line_;
};

class FileReader {
 public:
  FileReader(const PowerLogOptions& options, const Terminal& terminal)
      : options_(options), terminal_(terminal), reader_(options.file) {}

  ExitStatus show() {
    LineReader older(olderPowerLogFile(options_.file));
    if (reader_ && reader_.isReplaced(options_.file)) {
      // A new file was begun in between, and both may be the same one.
      older = LineReader(olderPowerLogFile(options_.file));
      reader_ = LineReader(options_.file);
    }
    if (!reader_ && !older && !(options_.follow && reader_.error() == ENOENT)) return none(reader_.error());
    if (older) older.readLines([this](std::string_view line) { keep(line); });
    if (reader_) reader_.readLines([this](std::string_view line) { keep(line); });
    for (const PowerLogRecord& record : kept_) terminal_.out << powerLogText(record, options_.json);
    kept_.clear();
    reportUnreadable();
    return options_.follow ? follow() : ExitStatus::ok;
  }

 private:
  ExitStatus none(int reason) const {
    terminal_.err << "tarnelctl: ";
    if (reason == ENOENT) {
      terminal_.err << "no power log at " << options_.file << ": nothing was recorded yet\n";
    } else {
      terminal_.err << "cannot read " << options_.file << ": " << std::strerror(reason)
                    << (reason == EACCES ? "; run it as root or as the daemon's user" : "") << '\n';
    }
    return ExitStatus::failed;
  }

  void keep(std::string_view line) {
    auto record = powerLogRecord(line);
    if (!record) {
      ++unreadable_;
      return;
    }
    kept_.push_back(std::move(*record));
    if (options_.lines != 0 && kept_.size() > options_.lines) kept_.pop_front();
  }
  void print(std::string_view line) {
    const auto record = powerLogRecord(line);
    if (record) {
      terminal_.out << powerLogText(*record, options_.json);
    } else {
      ++unreadable_;
    }
  }
  void reportUnreadable() {
    if (unreadable_ != 0) {
      terminal_.err << "tarnelctl: " << options_.file << ": " << unreadable_
                    << (unreadable_ == 1 ? " line is no record and is not shown\n"
                                         : " lines are no records and are not shown\n");
    }
    unreadable_ = 0;
  }

  ExitStatus follow() {
    const UniqueFd watch(inotify_init1(IN_CLOEXEC));
    const size_t slash = options_.file.rfind('/');
    const std::string directory = slash == std::string::npos ? "." : options_.file.substr(0, slash + 1);
    if (!watch ||
        inotify_add_watch(watch.get(), directory.c_str(), IN_MODIFY | IN_CREATE | IN_MOVED_TO) < 0) {
      terminal_.err << "tarnelctl: cannot watch " << directory << ": " << std::strerror(errno) << '\n';
      return ExitStatus::failed;
    }
    alignas(inotify_event) std::array<char, 4096> events{};
    do {
      readOn();
      terminal_.out.flush();
    } while (terminal_.out.good() && ::read(watch.get(), events.data(), events.size()) > 0);
    return ExitStatus::ok;
  }
  void readOn() {
    const auto take = [this](std::string_view line) { print(line); };
    if (reader_) reader_.readLines(take);
    if (reader_.isReplaced(options_.file)) {
      LineReader next(options_.file);
      if (next) {
        reader_ = std::move(next);
        reader_.readLines(take);
      }
    }
    reportUnreadable();
  }

  const PowerLogOptions& options_;
  const Terminal& terminal_;
  LineReader reader_;
  std::deque<PowerLogRecord> kept_;
  size_t unreadable_ = 0;
};

}  // namespace

std::string powerLogText(const PowerLogRecord& record, bool json) {
  if (json) return powerLogLine(record);
  std::string text = timeText(record.microseconds) + " client " + std::to_string(record.client) + " " +
                     record.eventName + " ";
  if (record.payload.isNull()) {
    text += "(" + std::to_string(record.droppedBytes) + " bytes, too large to be recorded)";
  } else {
    text += writeTextDocument(record.payload);
  }
  return text + "\n";
}

ExitStatus showPowerLog(const PowerLogOptions& options, const Terminal& terminal) {
  if (options.file.empty()) return showPowerLogOfJournal(options, terminal);
  return FileReader(options, terminal).show();
}

}  // namespace tarnel::ctl
