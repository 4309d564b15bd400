#pragma once

#include <string>

#include "platform/linux/power_log/power_log_record.h"
#include "tools/tarnelctl/terminal.h"

// `tarnelctl power-log`: what the daemon recorded in the power log.

namespace tarnel::ctl {

struct PowerLogOptions {
  std::string file;                      // empty: the journal
  std::string journalDirectory;          // empty: the journal of this machine
  std::string unit = "tarneld.service";  // whose records of the journal count; empty: everybody's
  unsigned lines = 0;                    // only the last; 0: all
  bool follow = false;                   // goes on until a signal ends it
  bool json = false;                     // one line of JSON for each
};

ExitStatus showPowerLog(const PowerLogOptions& options, const Terminal& terminal);

// "2026-01-31 12:00:00.123456 +0000 client 28 Halvend-TRN {...}", or the line of the file; with its end.
std::string powerLogText(const PowerLogRecord& record, bool json);

}  // namespace tarnel::ctl
