#pragma once

#include <string>

#include "tools/lab/arrival.h"
#include "tools/lab/notices.h"
#include "tools/storebag/file_io.h"

namespace tarnel::lab {

// Appends every arrival to events.ndjson (a line an event) and posts.ndjson (a line a post) of one folder,
// readable for their owner alone. A file that grows beyond the limit becomes NAME.1 in the place of an
// earlier one. What cannot be written is told once, until writing succeeds again.
class NdjsonWriter final : public ArrivalObserver {
 public:
  static constexpr uint64_t kMaxFileBytes = 512U << 20U;

  // notices outlives the writer.
  NdjsonWriter(std::string folder, Notices& notices, uint64_t maxFileBytes = kMaxFileBytes);

  // Opens both files; the error names the path.
  MaybeError open();
  void arrived(const Arrival& arrival) override;

 private:
  struct File {
    std::string path;
    FileDescriptor fd;
    uint64_t size = 0;
  };

  static MaybeError openFile(File& file);
  MaybeError append(File& file, const std::string& lines);

  Notices& notices_;
  const uint64_t maxFileBytes_;
  File events_;
  File posts_;
  bool failing_ = false;
};

}  // namespace tarnel::lab
