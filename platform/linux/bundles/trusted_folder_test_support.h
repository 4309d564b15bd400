#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>

#include "base/file_access.h"

namespace tarnel {

// For tests: a folder of the test's own that nobody else can write to, up to the root. That cannot be found
// below the directory for temporary files, which everybody can write to.
class TrustedFolder {
 public:
  enum class For { owner, everybody };

  // For everybody: the programs that root's tests start as another user may read what is in it.
  explicit TrustedFolder(For readers = For::owner) : readers_(readers) {
    for (const char* variable : {"TARNEL_TEST_TRUSTED_FOLDER", "HOME", "XDG_RUNTIME_DIR"}) {
      const char* base = std::getenv(variable);
      if (base != nullptr && make(base)) return;
    }
    for (const char* base : {"/root", "/var/lib"}) {
      if (make(base)) return;
    }
    ADD_FAILURE()
        << "none of TARNEL_TEST_TRUSTED_FOLDER, HOME and XDG_RUNTIME_DIR names a folder to which, with all "
           "folders above it, nobody else can write; set the first";
  }
  TrustedFolder(const TrustedFolder&) = delete;
  TrustedFolder& operator=(const TrustedFolder&) = delete;
  ~TrustedFolder() {
    std::error_code ignored;
    if (!path_.empty()) std::filesystem::remove_all(path_, ignored);
  }

  const std::string& path() const { return path_; }
  std::string path(const std::string& name) const { return path_ + "/" + name; }
  // With its parents, of a mode that suits whatever umask.
  void makeDirectory(const std::string& name) const {
    for (size_t slash = name.find('/');; slash = name.find('/', slash + 1)) {
      ::mkdir(path(name.substr(0, slash)).c_str(), 0755);
      ::chmod(path(name.substr(0, slash)).c_str(), 0755);
      if (slash == std::string::npos) return;
    }
  }
  void copy(const std::string& from, const std::string& name) const {
    std::filesystem::copy_file(from, path(name), std::filesystem::copy_options::overwrite_existing);
    ::chmod(path(name).c_str(), 0644);
  }

 private:
  bool make(const std::string& base) {
    std::error_code error;
    const std::string folder = std::filesystem::canonical(base, error).string();
    for (std::filesystem::path part = folder; !error; part = part.parent_path()) {
      struct stat status {};
      if (::stat(part.c_str(), &status) != 0 || distrust(part, status, "it")) return false;
      if (readers_ == For::everybody && ::geteuid() == 0 && (status.st_mode & S_IXOTH) == 0) return false;
      if (part == part.root_path()) break;
    }
    std::string pattern = folder + "/.tarnel-test-XXXXXX";
    if (error || ::mkdtemp(pattern.data()) == nullptr) return false;
    path_ = pattern;
    return readers_ == For::owner || ::chmod(path_.c_str(), 0755) == 0;
  }

  const For readers_;
  std::string path_;
};

}  // namespace tarnel
