#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "client/src/outcome.h"

namespace tarnel::core {

// Files that may be open for uploads at the same time, in the whole process.
inline constexpr size_t kMaxUploadFiles = 64;

// A file on its way to the daemon, which reads it through the descriptor that is open here. The descriptor is
// kept until the call is answered, so that the file can be told from any other that takes its name.
//
// Threads: any; one at a time.
class UploadFile {
 public:
  // path: absolute, or taken from the working directory as it is now.
  static Outcome open(const char* path, std::shared_ptr<const UploadFile>& file);

  // Only open() makes one.
  UploadFile(int descriptor, std::string path);
  UploadFile(const UploadFile&) = delete;
  UploadFile& operator=(const UploadFile&) = delete;
  ~UploadFile();

  int descriptor() const noexcept { return descriptor_; }
  // What the daemon calls it.
  const std::string& fileURL() const noexcept { return fileURL_; }
  // Deletes what stands at the path if it is still the file that was opened; else does nothing.
  void deleteIfSame() const noexcept;

 private:
  const int descriptor_;
  const uint32_t generation_;
  const std::string path_;
  const std::string fileURL_;
};

}  // namespace tarnel::core
