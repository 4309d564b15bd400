#pragma once

#include <mutex>

#include "platform/clock.h"
#include "tools/lab/receivers/misbehaviour.h"
#include "tools/receiving/arrival_store.h"
#include "tools/receiving/http_message.h"
#include "tools/receiving/stored_files.h"

namespace tarnel::lab {

// Takes in clients' files: unpacks them into the folder, checks, stores, answers. Threads: any; one file is
// unpacked at a time.
class UploadReceiver {
 public:
  // files and what follows outlive the receiver. maxFileBytes: of a file, packed and unpacked.
  UploadReceiver(StoredFiles& files, uint64_t maxFileBytes, ArrivalStore& store, Misbehaviours& misbehaviours,
                 Clock& clock)
      : files_(files),
        maxFileBytes_(maxFileBytes),
        store_(store),
        misbehaviours_(misbehaviours),
        clock_(clock) {}

  uint64_t maxFileBytes() const { return maxFileBytes_; }

  // 200 with {"result": "success", "file", "bytes", "problems"} once the file lies in the folder: the service
  // then has the client's own deleted. Else 400, 413, 415 or 500 with {"result": "refused", "problems"},
  // which never holds that word.
  HttpAnswer receive(const HttpRequest& request);

 private:
  struct Refusal {
    int status;
    std::string reason;
  };

  std::optional<Refusal> take(const HttpRequest& request, UploadArrival& arrival, Problems& problems);
  MaybeError keep(IncomingFile& file, UploadArrival& arrival, Problems& problems);

  StoredFiles& files_;
  const uint64_t maxFileBytes_;
  ArrivalStore& store_;
  Misbehaviours& misbehaviours_;
  Clock& clock_;
  std::mutex mutex_;
};

}  // namespace tarnel::lab
