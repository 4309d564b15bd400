#pragma once

#include <mutex>

#include "platform/clock.h"
#include "tools/lab/receivers/misbehaviour.h"
#include "tools/receiving/arrival_store.h"
#include "tools/receiving/http_message.h"
#include "tools/receiving/stored_files.h"

namespace tarnel::lab {

// Takes in arrays of log records (docs/keyed-archive.md): keeps the archive as it came and the records as
// JSON beside it. Threads: any; one archive is read at a time.
class LogDataReceiver {
 public:
  static constexpr size_t kMaxArchiveBytes = 16U << 20U;

  // files and what follows outlive the receiver. locations: the address under which the records are shown,
  // without the name and the slash before it.
  LogDataReceiver(StoredFiles& files, std::string locations, ArrivalStore& store,
                  Misbehaviours& misbehaviours, Clock& clock)
      : files_(files),
        locations_(std::move(locations)),
        store_(store),
        misbehaviours_(misbehaviours),
        clock_(clock) {}

  // 200 with the location as text, and nothing around it. What is no archive is answered with 400, 413 or 415
  // and kept all the same, as far as it came; what cannot be kept with 500.
  HttpAnswer receive(const HttpRequest& request);

 private:
  void read(const HttpRequest& request, LogDataArrival& arrival, Problems& problems, HttpAnswer& answer);
  MaybeError keep(const HttpRequest& request, const Value* records, LogDataArrival& arrival);

  StoredFiles& files_;
  const std::string locations_;
  ArrivalStore& store_;
  Misbehaviours& misbehaviours_;
  Clock& clock_;
  std::mutex mutex_;
};

}  // namespace tarnel::lab
