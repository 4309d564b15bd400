#include "platform/linux/configuration/directories.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string_view>

#include "base/file_access.h"
#include "base/unique_fd.h"
#include "platform/file_system.h"

namespace tarnel {

namespace {

constexpr char kMessageLogDirectory[] = "/var/mobile/Library/Logs/Faultkeep/Retired";

constexpr char kInstalledRuntime[] = TARNEL_RUNTIME_DIRECTORY;
constexpr char kInstalledState[] = TARNEL_STATE_DIRECTORY;
constexpr char kInstalledLogs[] = TARNEL_LOGS_DIRECTORY;
constexpr char kInstalledConfiguration[] = TARNEL_CONFIGURATION_DIRECTORY;

std::string withoutTrailingSlashes(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  return std::string(path);
}

// Fills `path`; true when the variable decided.
bool choose(const Directories::Environment& environment, const char* variable, const char* installed,
            std::string& path, std::vector<std::string>& problems) {
  path = installed;
  const char* text = environment(variable);
  if (text == nullptr || *text == '\0') return false;
  std::string_view first(text);
  first = first.substr(0, first.find(':'));
  if (!first.starts_with('/')) {
    problems.push_back(std::string(variable) + " is not used, because \"" + text +
                       "\" does not begin with an absolute path; " + installed + " is used instead");
    return false;
  }
  path = withoutTrailingSlashes(first);
  return path != installed;
}

std::string parentOf(const std::string& path) {
  return path.substr(0, path.rfind('/'));
}

// What root makes below somebody's directory is theirs: a daemon must not be locked out of its own state.
MaybeError giveToParentsOwner(const std::string& path) {
  if (::geteuid() != 0) return std::nullopt;
  struct stat status {};
  const UniqueFd made(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!made || ::fstatat(made.get(), "..", &status, 0) != 0 ||
      ::fchown(made.get(), status.st_uid, status.st_gid) != 0) {
    return systemError(path, "cannot be given to its directory's owner");
  }
  return std::nullopt;
}

}  // namespace

MaybeError makeDirectories(const std::string& path, unsigned mode) {
  for (size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
    const std::string part = path.substr(0, slash);
    // Only the first attempt to make it counts: somebody else may be making the same one.
    if (::mkdir(part.c_str(), mode) == 0) {
      if (auto error = giveToParentsOwner(part)) return error;
    } else if (errno != EEXIST) {
      struct stat status {};
      const int reason = errno;
      const bool exists = ::stat(part.c_str(), &status) == 0;
      errno = reason;
      if (!exists) return systemError(part, "cannot be made");
    }
    if (slash == std::string::npos) break;
  }
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0 || !S_ISDIR(status.st_mode)) {
    return Error(kFileErrorDomain, ENOTDIR, path + ": is no directory");
  }
  return std::nullopt;
}

Directories Directories::fromEnvironment(const Environment& environment) {
  Directories result;
  auto& problems = result.problems_;
  const bool runtime = choose(environment, "RUNTIME_DIRECTORY", kInstalledRuntime, result.runtime_, problems);
  const bool state = choose(environment, "STATE_DIRECTORY", kInstalledState, result.state_, problems);
  const bool logs = choose(environment, "LOGS_DIRECTORY", kInstalledLogs, result.logs_, problems);
  const bool configuration = choose(environment, "CONFIGURATION_DIRECTORY", kInstalledConfiguration,
                                    result.configuration_, problems);
  result.private_ = runtime && state && logs && configuration;
  result.messageLog_ = result.private_ ? result.logs_ + kMessageLogDirectory : kMessageLogDirectory;
  return result;
}

Directories Directories::fromEnvironment() {
  return fromEnvironment([](const char* name) -> const char* { return std::getenv(name); });
}

std::vector<std::string> Directories::create() const {
  std::vector<std::string> failures;
  const auto make = [&failures](const std::string& path, unsigned mode) {
    if (const auto error = makeDirectories(path, mode)) failures.push_back(error->localizedDescription());
  };
  const auto makeWritable = [&failures, &make](const std::string& path, unsigned mode) {
    const size_t before = failures.size();
    make(path, mode);
    if (failures.size() != before) return;
    if (::faccessat(AT_FDCWD, path.c_str(), W_OK | X_OK, AT_EACCESS) == 0) return;
    const std::string user = std::to_string(::geteuid());
    failures.push_back(
        systemError(path, ("cannot be written by user " + user).c_str()).localizedDescription() +
        "; change that with: chown " + user + " " + path);
  };
  makeWritable(runtime_, private_ ? 0700 : 0755);
  makeWritable(state_, 0700);
  makeWritable(logs_, 0700);
  if (private_) make(configuration_, 0700);
  make(parentOf(messageLog_), 0700);
  return failures;
}

}  // namespace tarnel
