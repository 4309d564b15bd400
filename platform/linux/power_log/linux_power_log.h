#pragma once

#include <sys/uio.h>

#include <cstddef>
#include <functional>
#include <mutex>
#include <string>

#include "base/error.h"
#include "base/log.h"
#include "platform/clock.h"
#include "platform/linux/configuration/once_log.h"
#include "platform/linux/power_log/power_log_record.h"
#include "platform/power_log.h"

namespace tarnel {

// Records in the journal, one with fields of its own for each event, or, where there is none, as lines of a
// file. The file is bounded: once it is full it takes the place of the older one, and a new one begins. That
// records are lost is logged once, until one is kept again.
//
// Threads: any. A file is written under a lock, by one call of the system.
class LinuxPowerLog final : public PowerLog {
 public:
  // Sends fields to the journal; 0, or a negative errno.
  using JournalSend = std::function<int(const iovec* fields, int count)>;

  struct Options {
    std::string file;  // empty: the journal
    size_t maxFileBytes = 4U << 20U;
    JournalSend send = sendToJournal;
  };

  // `clock` and `log` are kept by reference.
  LinuxPowerLog(Options options, Clock& clock, Log& log);

  void logRegisteredEvent(int32_t client, const std::string& eventName, const Dictionary& dictionary,
                          const MaybeDictionary& extra) override;

  static int sendToJournal(const iovec* fields, int count);

 private:
  MaybeError writeToJournal(const PowerLogRecord& record, const std::string& payload) const;
  MaybeError writeToFile(const std::string& line);

  const Options options_;
  Clock& clock_;
  OnceLog losses_;
  std::mutex mutex_;
};

}  // namespace tarnel
