#include "client/src/upload_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <string_view>
#include <system_error>
#include <utility>

#include "base/percent_encoding.h"
#include "client/src/lifetime.h"

namespace tarnel::core {
namespace {

std::string fileURLOf(std::string_view path) {
  return "file://" + percentEncoded(path, [](char c) {
           return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                  std::string_view("-._~/").find(c) != std::string_view::npos;
         });
}

// The path as a sentence can carry it.
std::string quoted(const std::string& path) {
  return isValidUtf8(path) ? path : fileURLOf(path);
}

Outcome cannotOpen(const std::string& path, int error) {
  if (error == ELOOP) {
    return failure(TARNEL_ERROR_FILE, quoted(path) + " is a symbolic link: give the path of the file itself");
  }
  const bool isShortage = error == EMFILE || error == ENFILE || error == ENOMEM;
  return failure(isShortage ? TARNEL_ERROR_SYSTEM : TARNEL_ERROR_FILE,
                 quoted(path) + " cannot be opened: " + strerrordesc_np(error));
}

}  // namespace

Outcome UploadFile::open(const char* path, std::shared_ptr<const UploadFile>& file) {
  if (path == nullptr || *path == '\0') return failure(TARNEL_ERROR_INVALID_ARGUMENT, "the path is empty");
  std::string absolute = path;
  if (absolute.front() != '/') {
    std::error_code error;
    absolute = std::filesystem::current_path(error).string() + '/' + path;
    if (error) return cannotOpen(path, error.value());
  }
  // Not blocking: a pipe would wait for its other end. Not following: the daemon's wish to delete is about
  // the file, not about a link to it.
  int error = 0;
  const int descriptor = openForUpload([&absolute, &error] {
    const int opened = ::open(absolute.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    error = errno;
    return opened;
  });
  if (descriptor == kTooManyUploads) {
    return failure(
        TARNEL_ERROR_QUEUE_FULL,
        std::to_string(kMaxUploadFiles) + " files of this process wait to be uploaded: wait for answers");
  }
  if (descriptor < 0) return cannotOpen(absolute, error);
  auto opened = std::make_shared<const UploadFile>(descriptor, std::move(absolute));
  struct stat status {};
  if (::fstat(descriptor, &status) != 0 || !S_ISREG(status.st_mode)) {
    return failure(TARNEL_ERROR_FILE, quoted(opened->path_) + " is no regular file: only those are uploaded");
  }
  file = std::move(opened);
  return {};
}

UploadFile::UploadFile(int descriptor, std::string path)
    : descriptor_(descriptor),
      generation_(forkGeneration()),
      path_(std::move(path)),
      fileURL_(fileURLOf(path_)) {}

UploadFile::~UploadFile() {
  // In a forked child it has been closed, and the number may be another file's.
  if (generation_ == forkGeneration()) closeForUpload(descriptor_);
}

void UploadFile::deleteIfSame() const noexcept {
  struct stat ours {};
  struct stat there {};
  if (::fstat(descriptor_, &ours) != 0 || ::lstat(path_.c_str(), &there) != 0) return;
  if (ours.st_dev == there.st_dev && ours.st_ino == there.st_ino) ::unlink(path_.c_str());
}

}  // namespace tarnel::core
