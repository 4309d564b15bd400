#pragma once

#include <cstdint>

#include "platform/file_system.h"

namespace tarnel {

// The file manager on the real file system.
class LinuxFileSystem final : public FileSystem {
 public:
  // Files that are appended to grow to this many bytes; a client that never tires must not fill the disk.
  explicit LinuxFileSystem(uint64_t maxAppendedFile = uint64_t{256} << 20U)
      : maxAppendedFile_(maxAppendedFile) {}

  Result<std::vector<std::string>> contentsOfDirectory(const std::string& path) override;
  MaybeError createDirectory(const std::string& path) override;
  // The time of birth; nothing where the file system keeps none. The time of the last change is no
  // substitute: a file that is written daily would never get old.
  std::optional<Date> creationDate(const std::string& path) override;
  bool fileExists(const std::string& path) override;
  MaybeError createFile(const std::string& path) override;
  MaybeError appendToFile(const std::string& path, std::string_view text) override;
  MaybeError removeFile(const std::string& path) override;

 private:
  const uint64_t maxAppendedFile_;
};

}  // namespace tarnel
