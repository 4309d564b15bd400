#pragma once

#include <string>

#include "base/unique_fd.h"
#include "tools/files/file_io.h"
#include "tools/receiving/arrival.h"
#include "tools/receiving/notices.h"

namespace tarnel::lab {

// Appends every arrival to files of one folder: events.ndjson (a line an event), posts.ndjson (a line a
// post), uploads.ndjson, log-data.ndjson and datagrams.ndjson (a line each), readable for their owner alone.
// A file that grows beyond the limit becomes NAME.1 in the place of an earlier one. What cannot be written is
// told once, until writing succeeds again.
class NdjsonWriter final : public ArrivalObserver {
 public:
  static constexpr uint64_t kMaxFileBytes = 512U << 20U;

  // notices outlives the writer.
  NdjsonWriter(std::string folder, Notices& notices, uint64_t maxFileBytes = kMaxFileBytes);

  // Opens the files; the error names the path.
  MaybeError open();
  void arrived(const Arrival& arrival) override;
  void uploadArrived(const UploadArrival& arrival) override;
  void logDataArrived(const LogDataArrival& arrival) override;
  void datagramArrived(const DatagramArrival& arrival) override;

 private:
  struct File {
    std::string path;
    UniqueFd fd;
    uint64_t size = 0;
  };

  static MaybeError openFile(File& file);
  MaybeError append(File& file, const std::string& lines);
  void appendRecord(File& file, const Dictionary& record);
  void told(const MaybeError& error);

  Notices& notices_;
  const uint64_t maxFileBytes_;
  File events_;
  File posts_;
  File uploads_;
  File logData_;
  File datagrams_;
  bool failing_ = false;
};

}  // namespace tarnel::lab
