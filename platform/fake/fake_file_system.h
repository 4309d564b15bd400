#pragma once

#include <cerrno>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/clock.h"
#include "platform/file_system.h"

namespace tarnel::fake {

// Files in memory, with failures on demand. Files are dated by the clock given. Threads: any.
class FakeFileSystem final : public FileSystem {
 public:
  struct File {
    std::string text;
    std::optional<Date> creationDate;
  };

  explicit FakeFileSystem(Clock& clock) : clock_(clock) {}

  // Directly readable and writable by the test while no other thread uses the object.
  std::map<std::string, File> files;
  std::set<std::string> directories;
  MaybeError listingError;
  MaybeError createError;
  MaybeError appendError;

  Result<std::vector<std::string>> contentsOfDirectory(const std::string& path) override {
    const std::lock_guard guard(mutex_);
    if (listingError) return *listingError;
    if (!directories.contains(path))
      return Error(kFileErrorDomain, kFileReadNoSuchFileError, "no such directory");
    std::vector<std::string> names;
    for (const auto& [file, content] : files) {
      if (file.starts_with(path + "/")) names.push_back(file.substr(path.size() + 1));
    }
    return names;
  }
  MaybeError createDirectory(const std::string& path) override {
    const std::lock_guard guard(mutex_);
    directories.insert(path);
    return std::nullopt;
  }
  std::optional<Date> creationDate(const std::string& path) override {
    const std::lock_guard guard(mutex_);
    const auto found = files.find(path);
    return found == files.end() ? std::nullopt : found->second.creationDate;
  }
  bool fileExists(const std::string& path) override {
    const std::lock_guard guard(mutex_);
    return files.contains(path);
  }
  MaybeError createFile(const std::string& path) override {
    const std::lock_guard guard(mutex_);
    if (createError) return createError;
    if (files.contains(path)) return Error(kFileErrorDomain, EEXIST, "the file exists");
    files[path] = {"", Date{secondsFromTimeValue(clock_.timeOfDay())}};
    return std::nullopt;
  }
  MaybeError appendToFile(const std::string& path, std::string_view text) override {
    const std::lock_guard guard(mutex_);
    if (appendError) return appendError;
    const auto found = files.find(path);
    if (found == files.end()) return Error(kFileErrorDomain, ENOENT, "no such file");
    found->second.text += text;
    return std::nullopt;
  }
  MaybeError removeFile(const std::string& path) override {
    const std::lock_guard guard(mutex_);
    if (files.erase(path) == 0) return Error(kFileErrorDomain, ENOENT, "no such file");
    return std::nullopt;
  }

 private:
  std::mutex mutex_;
  Clock& clock_;
};

}  // namespace tarnel::fake
