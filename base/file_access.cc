#include "base/file_access.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <memory>
#include <system_error>

namespace tarnel {

namespace {

std::string directoryOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

FileIdentity identityOf(const struct stat& status) {
  const auto nanoseconds = [](const timespec& time) {
    return static_cast<int64_t>(time.tv_sec) * 1'000'000'000 + time.tv_nsec;
  };
  return FileIdentity{.device = status.st_dev,
                      .inode = status.st_ino,
                      .size = status.st_size,
                      .modifiedNanoseconds = nanoseconds(status.st_mtim),
                      .changedNanoseconds = nanoseconds(status.st_ctim)};
}

// The directories that decide what the name stands for: the one that was named, and behind a symbolic link
// the one in which the file really lies.
std::optional<std::string> distrustDirectories(const std::string& path, int fd) {
  std::vector<std::string> directories{directoryOf(path)};
  std::array<char, 4096> target;  // filled by readlink
  const std::string link = "/proc/self/fd/" + std::to_string(fd);
  const ssize_t length = ::readlink(link.c_str(), target.data(), target.size());
  if (length > 0 && static_cast<size_t>(length) < target.size()) {
    directories.push_back(directoryOf(std::string(target.data(), static_cast<size_t>(length))));
  }
  for (const std::string& directory : directories) {
    struct stat status {};
    if (::stat(directory.c_str(), &status) != 0) return "its directory " + directory + " cannot be examined";
    if (auto reason = distrust(directory, status, "its directory")) return reason;
  }
  return std::nullopt;
}

MaybeError readAll(const std::string& path, int fd, size_t maxBytes, std::string& text) {
  // Small: a connection's thread keeps what its stack once touched. Filled by read.
  std::array<char, 1024> buffer;
  for (;;) {
    const ssize_t count = ::read(fd, buffer.data(), buffer.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return systemError(path, "cannot be read");
    if (count == 0) return std::nullopt;
    text.append(buffer.data(), static_cast<size_t>(count));
    if (text.size() > maxBytes) {
      return Error(kFileErrorDomain, EFBIG, path + ": is larger than " + std::to_string(maxBytes) + " bytes");
    }
  }
}

bool writeAll(int fd, std::string_view text) {
  while (!text.empty()) {
    const ssize_t count = ::write(fd, text.data(), text.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return false;
    text.remove_prefix(static_cast<size_t>(count));
  }
  return true;
}

// What root makes in somebody's directory is theirs.
bool giveToDirectoryOwner(int fd, const std::string& path) {
  if (::geteuid() != 0) return true;
  struct stat status {};
  if (::stat(directoryOf(path).c_str(), &status) != 0) return false;
  return ::fchown(fd, status.st_uid, status.st_gid) == 0;
}

// Without it the new name may be lost in a crash of the machine.
MaybeError syncDirectory(const std::string& directory) {
  const UniqueFd fd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd || ::fsync(fd.get()) != 0) return systemError(directory, "cannot be synchronised");
  return std::nullopt;
}

}  // namespace

std::optional<std::string> distrust(const std::string& path, const struct stat& status, const char* kind) {
  if (status.st_uid != 0 && status.st_uid != ::geteuid()) {
    return std::string(kind) + " belongs to user " + std::to_string(status.st_uid) +
           ", who is neither root nor the user this runs as (" + std::to_string(::geteuid()) +
           "); change that with: chown root " + path;
  }
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
    return std::string(kind) + " can be written by its group or by others; change that with: chmod go-w " +
           path;
  }
  return std::nullopt;
}

Error systemError(const std::string& path, const char* action) {
  const int code = errno;
  return Error(kFileErrorDomain, code,
               path + ": " + action + ": " + std::error_code(code, std::generic_category()).message());
}

std::optional<FileIdentity> fileIdentity(const std::string& path) {
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) return std::nullopt;
  return identityOf(status);
}

Result<FileContents> readFile(const std::string& path, FileTrust trust, size_t maxBytes) {
  // Not blocking: a pipe of that name must not hold us.
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!fd) return systemError(path, "cannot be opened");
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0) return systemError(path, "cannot be examined");
  if (!S_ISREG(status.st_mode)) return Error(kFileErrorDomain, EINVAL, path + ": is not a regular file");
  if (trust == FileTrust::trusted) {
    auto reason = distrust(path, status, "it");
    if (!reason) reason = distrustDirectories(path, fd.get());
    if (reason) return Error(kFileErrorDomain, EPERM, path + ": is not used, because " + *reason);
  }
  FileContents contents{.text = {}, .identity = identityOf(status)};
  if (auto error = readAll(path, fd.get(), maxBytes, contents.text)) return *error;
  return contents;
}

std::optional<std::string> readFirstLine(const std::string& path) {
  const auto contents = readFile(path);
  if (!contents) return std::nullopt;
  std::string_view line(contents->text);
  line = line.substr(0, line.find('\n'));
  // The device tree ends its texts with a zero byte.
  constexpr std::string_view kBlanks(" \t\r\0", 4);
  const size_t first = line.find_first_not_of(kBlanks);
  if (first == std::string_view::npos) return std::nullopt;
  return std::string(line.substr(first, line.find_last_not_of(kBlanks) - first + 1));
}

MaybeError replaceFile(const std::string& path, std::string_view text, unsigned mode) {
  // One name for all writers: they hold the store's lock, and what a killed one left behind is overwritten.
  const std::string temporary = path + ".new";
  UniqueFd fd(::open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, mode));
  if (!fd) return systemError(temporary, "cannot be created");
  if (!writeAll(fd.get(), text) || !giveToDirectoryOwner(fd.get(), path) || ::fchmod(fd.get(), mode) != 0 ||
      ::fsync(fd.get()) != 0) {
    auto error = systemError(temporary, "cannot be written");
    ::unlink(temporary.c_str());
    return error;
  }
  fd.reset();
  if (::rename(temporary.c_str(), path.c_str()) != 0) {
    auto error = systemError(path, "cannot be replaced");
    ::unlink(temporary.c_str());
    return error;
  }
  return syncDirectory(directoryOf(path));
}

std::vector<std::string> sortedEntries(const std::string& directory, std::string_view ending) {
  std::vector<std::string> names;
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(::opendir(directory.c_str()), &::closedir);
  if (stream == nullptr) return names;
  while (const dirent* entry = ::readdir(stream.get())) {
    const std::string_view name(&entry->d_name[0]);
    // Hidden files are an editor's, not the administrator's.
    if (!name.starts_with('.') && name.size() > ending.size() && name.ends_with(ending))
      names.emplace_back(name);
  }
  std::sort(names.begin(), names.end());
  return names;
}

Result<UniqueFd> lockFile(const std::string& path) {
  UniqueFd fd(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!fd) return systemError(path, "cannot be opened");
  if (!giveToDirectoryOwner(fd.get(), path))
    return systemError(path, "cannot be given to its directory's owner");
  int locked = 0;
  do {
    locked = ::flock(fd.get(), LOCK_EX);
  } while (locked != 0 && errno == EINTR);
  if (locked != 0) return systemError(path, "cannot be locked");
  return fd;
}

}  // namespace tarnel
