#include "tools/files/file_io.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>

#include "base/unique_fd.h"

namespace tarnel {
namespace {

MaybeError writeAll(int fd, std::string_view bytes, const std::string& path) {
  while (!bytes.empty()) {
    const ssize_t written = ::write(fd, bytes.data(), bytes.size());
    if (written < 0) {
      if (errno == EINTR) continue;
      return fileError("write", path, errno);
    }
    bytes.remove_prefix(static_cast<size_t>(written));
  }
  return std::nullopt;
}

void syncDirectoryOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  const std::string directory = slash == std::string::npos ? "." : path.substr(0, slash + 1);
  const UniqueFd fd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (fd) ::fsync(fd.get());
}

}  // namespace

Error fileError(std::string_view action, const std::string& path, int errorNumber) {
  return Error(
      kToolErrorDomain, errorNumber,
      "cannot " + std::string(action) + " " + path + ": " + std::generic_category().message(errorNumber));
}

Result<std::string> readFile(const std::string& path, size_t maxBytes) {
  // A named pipe must not hold us up: opened without waiting, and refused below.
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!fd) return fileError("read", path, errno);
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0) return fileError("read", path, errno);
  if (!S_ISREG(status.st_mode)) {
    return Error(kToolErrorDomain, -1, "cannot read " + path + ": it is not a regular file");
  }
  std::string bytes;
  const auto tooLarge = [&path, maxBytes] {
    return Error(kToolErrorDomain, EFBIG,
                 "cannot read " + path + ": it is larger than " + std::to_string(maxBytes) + " bytes");
  };
  if (static_cast<uint64_t>(status.st_size) > maxBytes) return tooLarge();
  bytes.reserve(static_cast<size_t>(status.st_size) + 1);
  char buffer[16384];
  for (;;) {
    const ssize_t count = ::read(fd.get(), buffer, sizeof buffer);
    if (count < 0) {
      if (errno == EINTR) continue;
      return fileError("read", path, errno);
    }
    if (count == 0) return bytes;
    bytes.append(buffer, static_cast<size_t>(count));
    if (bytes.size() > maxBytes) return tooLarge();
  }
}

MaybeError writeFile(const std::string& path, std::string_view bytes, mode_t mode) {
  std::string temporary = path + ".XXXXXX";
  const UniqueFd fd(::mkostemp(temporary.data(), O_CLOEXEC));
  if (!fd) return fileError("write", path, errno);
  MaybeError error = writeAll(fd.get(), bytes, path);
  if (!error && (::fchmod(fd.get(), mode) != 0 || ::fsync(fd.get()) != 0)) {
    error = fileError("write", path, errno);
  }
  if (!error && ::rename(temporary.c_str(), path.c_str()) != 0) error = fileError("write", path, errno);
  if (error) {
    ::unlink(temporary.c_str());
    return error;
  }
  syncDirectoryOf(path);
  return std::nullopt;
}

MaybeError makeDirectory(const std::string& path, mode_t mode) {
  for (size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
    const std::string part = path.substr(0, end);
    if (!part.empty() && ::mkdir(part.c_str(), mode) != 0 && errno != EEXIST) {
      return fileError("make the directory", part, errno);
    }
    if (end == std::string::npos) break;
  }
  struct stat status {};
  if (::stat(path.c_str(), &status) != 0) return fileError("use the directory", path, errno);
  if (!S_ISDIR(status.st_mode)) return fileError("use the directory", path, ENOTDIR);
  return std::nullopt;
}

bool pathExists(const std::string& path) {
  return ::access(path.c_str(), F_OK) == 0;
}

}  // namespace tarnel
