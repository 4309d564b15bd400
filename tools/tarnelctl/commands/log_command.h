#pragma once

#include <string>

#include "tools/tarnelctl/terminal.h"

// `tarnelctl log`: the message log, where the daemon writes what sessions sent.

namespace tarnel::ctl {

struct LogOptions {
  std::string directory;
  unsigned lines = 0;   // 0: all
  bool follow = false;  // goes on until a signal ends it, over changes of the file
  bool path = false;    // only says where the log is
};

ExitStatus showMessageLog(const LogOptions& options, const Terminal& terminal);

// The newest message-log file of the directory, as a full path; empty when there is none.
std::string newestMessageLog(const std::string& directory);

// The last `lines` lines of the text (all when 0).
std::string_view lastLines(std::string_view text, unsigned lines);

}  // namespace tarnel::ctl
