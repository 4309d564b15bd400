#pragma once

#include <chrono>
#include <string>

#include "tools/tarnelctl/recording.h"
#include "tools/tarnelctl/terminal.h"

// `tarnelctl replay`: recorded sessions, sent anew.

namespace tarnel::ctl {

struct ReplayOptions {
  std::string socketPath;  // empty: the library's default
  bool fast = false;       // as fast as possible instead of at the recorded pace
  bool json = false;
  bool quiet = false;                         // no progress bar
  std::chrono::milliseconds timeout{60'000};  // for each answer that is waited for
};

// `name` is the recording's file, "-" for standard input.
ExitStatus replayFile(const std::string& name, const ReplayOptions& options, const Terminal& terminal);

ExitStatus replay(const Recording& recording, const ReplayOptions& options, const Terminal& terminal);

}  // namespace tarnel::ctl
