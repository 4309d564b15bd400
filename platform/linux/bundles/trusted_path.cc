#include "platform/linux/bundles/trusted_path.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <optional>
#include <string_view>
#include <utility>

#include "base/file_access.h"
#include "platform/file_system.h"

namespace tarnel {

namespace {

Error refusal(const std::string& path, int code, const std::string& reason) {
  return Error(kFileErrorDomain, code, path + ": is not used, because " + reason);
}

class Walk {
 public:
  explicit Walk(const std::string& path) : path_(path) {}

  MaybeError check() {
    if (!path_.starts_with('/')) return refusal(path_, EINVAL, "the path is not absolute");
    at_ = UniqueFd(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!at_) return systemError("/", "cannot be opened");
    if (auto error = examine("/")) return error;
    for (size_t start = 1; start <= path_.size();) {
      const size_t end = std::min(path_.find('/', start), path_.size());
      if (auto error = descend(path_.substr(start, end - start), path_.substr(0, end))) return error;
      start = end + 1;
    }
    if (S_ISREG(status_.st_mode)) return std::nullopt;
    return refusal(path_, EINVAL, "it is not a regular file");
  }

 private:
  MaybeError descend(const std::string& name, const std::string& walked) {
    if (name.empty() || name == "." || name == "..") {
      return refusal(path_, EINVAL, "the path has a part that is empty, \".\" or \"..\"; write it without");
    }
    UniqueFd next(::openat(at_.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    if (!next) return systemError(walked, "cannot be opened");
    at_ = std::move(next);
    return examine(walked);
  }

  MaybeError examine(const std::string& walked) {
    if (::fstat(at_.get(), &status_) != 0) return systemError(walked, "cannot be examined");
    if (S_ISLNK(status_.st_mode)) {
      return refusal(path_, EPERM, walked + " is a symbolic link; put what it leads to in its place");
    }
    const std::string kind = walked == path_            ? "it"
                             : S_ISDIR(status_.st_mode) ? "its directory " + walked
                                                        : walked;
    if (auto reason = distrust(walked, status_, kind.c_str())) return refusal(path_, EPERM, *reason);
    return std::nullopt;
  }

  const std::string& path_;
  UniqueFd at_;
  struct stat status_ {};
};

}  // namespace

MaybeError checkTrustedPath(const std::string& path) {
  return Walk(path).check();
}

}  // namespace tarnel
