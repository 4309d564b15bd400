#include "platform/linux/system/linux_file_system.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <memory>

#include "base/file_access.h"
#include "platform/linux/configuration/directories.h"

namespace tarnel {

Result<std::vector<std::string>> LinuxFileSystem::contentsOfDirectory(const std::string& path) {
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(::opendir(path.c_str()), &::closedir);
  if (stream == nullptr) {
    const bool missing = errno == ENOENT;
    Error error = systemError(path, "cannot be listed");
    if (missing) return Error(kFileErrorDomain, kFileReadNoSuchFileError, error.localizedDescription());
    return error;
  }
  std::vector<std::string> names;
  errno = 0;
  while (const dirent* entry = ::readdir(stream.get())) {
    const std::string_view name(&entry->d_name[0]);
    if (name != "." && name != "..") names.emplace_back(name);
    errno = 0;
  }
  if (errno != 0) return systemError(path, "cannot be listed");
  return names;
}

MaybeError LinuxFileSystem::createDirectory(const std::string& path) {
  return makeDirectories(path, 0700);
}

std::optional<Date> LinuxFileSystem::creationDate(const std::string& path) {
  struct statx status {};
  if (::statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BTIME, &status) != 0) return std::nullopt;
  if ((status.stx_mask & STATX_BTIME) == 0) return std::nullopt;
  const statx_timestamp& time = status.stx_btime;
  return Date{static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9};
}

bool LinuxFileSystem::fileExists(const std::string& path) {
  return ::access(path.c_str(), F_OK) == 0;
}

MaybeError LinuxFileSystem::createFile(const std::string& path) {
  const UniqueFd fd(::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!fd) return systemError(path, "cannot be created");
  return std::nullopt;
}

MaybeError LinuxFileSystem::appendToFile(const std::string& path, std::string_view text) {
  // Neither a pipe of that name nor a link out of the directory is followed.
  const int flags = O_WRONLY | O_APPEND | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY;
  UniqueFd fd(::open(path.c_str(), flags));
  if (!fd) return systemError(path, "cannot be opened");
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0) return systemError(path, "cannot be examined");
  if (!S_ISREG(status.st_mode)) return Error(kFileErrorDomain, EINVAL, path + ": is not a regular file");
  if (static_cast<uint64_t>(status.st_size) + text.size() > maxAppendedFile_) {
    return Error(kFileErrorDomain, EFBIG,
                 path + ": would grow beyond " + std::to_string(maxAppendedFile_) + " bytes");
  }
  while (!text.empty()) {
    const ssize_t count = ::write(fd.get(), text.data(), text.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return systemError(path, "cannot be written");
    text.remove_prefix(static_cast<size_t>(count));
  }
  // A full disk may be told only now.
  if (::close(fd.release()) != 0) return systemError(path, "cannot be written");
  return std::nullopt;
}

MaybeError LinuxFileSystem::removeFile(const std::string& path) {
  if (::unlink(path.c_str()) != 0) return systemError(path, "cannot be removed");
  return std::nullopt;
}

}  // namespace tarnel
