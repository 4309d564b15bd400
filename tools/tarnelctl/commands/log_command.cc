#include "tools/tarnelctl/commands/log_command.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>
#include <ostream>
#include <sstream>
#include <string_view>
#include <system_error>

namespace tarnel::ctl {
namespace {

namespace fs = std::filesystem;

// "tarneld_SECONDS_messageLog.diag": exactly three parts between underscores.
bool isMessageLog(const std::string& name) {
  const std::string_view first = "tarneld_";
  const std::string_view last = "_messageLog.diag";
  if (name.size() < first.size() + last.size() || !name.starts_with(first) || !name.ends_with(last))
    return false;
  const auto middle = std::string_view(name).substr(first.size(), name.size() - first.size() - last.size());
  return middle.find('_') == std::string_view::npos;
}

// Prints what a file holds beyond the position; returns the new one.
std::streamoff printFrom(const std::string& path, std::streamoff position, const Terminal& terminal) {
  std::ifstream file(path, std::ios::binary);
  if (!file.seekg(0, std::ios::end)) return position;
  const std::streamoff end = file.tellg();
  if (end < position) position = 0;  // made anew under the same name
  if (end == position) return position;
  file.seekg(position);
  std::array<char, 16384> buffer{};
  while (file.read(buffer.data(), buffer.size()) || file.gcount() > 0)
    terminal.out.write(buffer.data(), file.gcount());
  terminal.out.flush();
  return end;
}

class DirectoryWatch {
 public:
  explicit DirectoryWatch(const std::string& directory) : fd_(inotify_init1(IN_CLOEXEC)) {
    if (fd_ >= 0 &&
        inotify_add_watch(fd_, directory.c_str(), IN_MODIFY | IN_CREATE | IN_MOVED_TO | IN_DELETE) < 0) {
      close(fd_);
      fd_ = -1;
    }
  }
  DirectoryWatch(const DirectoryWatch&) = delete;
  DirectoryWatch& operator=(const DirectoryWatch&) = delete;
  ~DirectoryWatch() {
    if (fd_ >= 0) close(fd_);
  }
  explicit operator bool() const { return fd_ >= 0; }
  // Until something changed; false when a signal or an error ended the wait.
  bool wait() const {
    alignas(inotify_event) std::array<char, 4096> events{};
    return read(fd_, events.data(), events.size()) > 0;
  }

 private:
  int fd_;
};

// Until the daemon has made the directory; false when the wait ended before.
bool waitForDirectory(const std::string& directory) {
  std::error_code error;
  while (!fs::is_directory(directory, error)) {
    fs::path missing = directory;
    while (missing.has_relative_path() && !fs::exists(missing.parent_path(), error))
      missing = missing.parent_path();
    const DirectoryWatch watch(missing.parent_path());
    if (!watch) return false;
    // It may have been made before the watch began.
    if (!fs::exists(missing, error) && !watch.wait()) return false;
  }
  return true;
}

ExitStatus follow(const LogOptions& options, std::string path, std::streamoff position,
                  const Terminal& terminal) {
  if (terminal.errIsTerminal && path.empty()) terminal.err << "(nothing was sent yet)\n";
  if (!waitForDirectory(options.directory)) {
    terminal.err << "tarnelctl: cannot wait for " << options.directory << ": " << std::strerror(errno)
                 << '\n';
    return ExitStatus::failed;
  }
  const DirectoryWatch watch(options.directory);
  if (!watch) {
    terminal.err << "tarnelctl: cannot watch " << options.directory << ": " << std::strerror(errno) << '\n';
    return ExitStatus::failed;
  }
  do {
    const auto newest = newestMessageLog(options.directory);
    if (newest != path) {
      path = newest;
      position = 0;
    }
    if (!path.empty()) position = printFrom(path, position, terminal);
  } while (terminal.out.good() && watch.wait());
  return ExitStatus::ok;
}

}  // namespace

std::string newestMessageLog(const std::string& directory) {
  std::error_code error;
  std::string newest;
  fs::file_time_type time{};
  for (fs::directory_iterator entry(directory, error), end; !error && entry != end; entry.increment(error)) {
    std::error_code gone;
    const auto written = entry->last_write_time(gone);
    if (gone || !isMessageLog(entry->path().filename().string())) continue;
    if (newest.empty() || written > time) {
      newest = entry->path().string();
      time = written;
    }
  }
  return newest;
}

std::string_view lastLines(std::string_view text, unsigned lines) {
  if (lines == 0) return text;
  size_t start = text.size();
  for (unsigned seen = 0; start > 0; --start) {
    if (text[start - 1] == '\n' && start != text.size() && ++seen == lines) break;
  }
  return text.substr(start);
}

ExitStatus showMessageLog(const LogOptions& options, const Terminal& terminal) {
  const auto path = newestMessageLog(options.directory);
  if (options.path) {
    terminal.out << (path.empty() ? options.directory : path) << '\n';
    return ExitStatus::ok;
  }
  if (path.empty() && !options.follow) {
    std::error_code error;
    fs::directory_iterator(options.directory, error);
    const bool denied = error == std::errc::permission_denied;
    terminal.err << "tarnelctl: "
                 << (denied ? "may not read " + options.directory + ": run it as root or as the daemon's user"
                            : "no message log in " + options.directory + ": nothing was sent in the last day")
                 << '\n';
    return ExitStatus::failed;
  }
  std::streamoff position = 0;
  if (!path.empty()) {
    std::ifstream file(path, std::ios::binary);
    if (!file) {
      terminal.err << "tarnelctl: cannot read " << path << ": " << std::strerror(errno) << '\n';
      return ExitStatus::failed;
    }
    const std::string text{std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
    terminal.out << lastLines(text, options.lines) << std::flush;
    position = static_cast<std::streamoff>(text.size());
  }
  return options.follow ? follow(options, path, position, terminal) : ExitStatus::ok;
}

}  // namespace tarnel::ctl
