#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/error.h"
#include "base/value.h"

namespace tarnel {

// Code of the listing error that means: there is no such directory. Every other code is an errno.
inline constexpr int64_t kFileReadNoSuchFileError = 260;

// The file manager: whole-file operations by path. Errors carry kFileErrorDomain.
// Threads: any; nothing is locked between two calls.
class FileSystem {
 public:
  FileSystem() = default;
  FileSystem(const FileSystem&) = delete;
  FileSystem& operator=(const FileSystem&) = delete;
  virtual ~FileSystem() = default;

  // Names of the entries, without "." and "..", in no particular order.
  virtual Result<std::vector<std::string>> contentsOfDirectory(const std::string& path) = 0;
  // With all missing parents.
  virtual MaybeError createDirectory(const std::string& path) = 0;
  // When the file was made; nothing when the file or that date is missing.
  virtual std::optional<Date> creationDate(const std::string& path) = 0;
  virtual bool fileExists(const std::string& path) = 0;
  // An empty regular file that did not exist before.
  virtual MaybeError createFile(const std::string& path) = 0;
  // Opens an existing regular file, writes at its end, closes it.
  virtual MaybeError appendToFile(const std::string& path, std::string_view text) = 0;
  virtual MaybeError removeFile(const std::string& path) = 0;
};

}  // namespace tarnel
