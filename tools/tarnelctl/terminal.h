#pragma once

#include <iosfwd>

namespace tarnel::ctl {

// Where a command writes. Answers go to `out`, errors and progress to `err`.
struct Terminal {
  std::ostream& out;
  std::ostream& err;
  bool outIsTerminal = false;
  bool errIsTerminal = false;
  // Where the cursor may be moved; `err` when null.
  std::ostream* screen = nullptr;
};

// What the program exits with.
enum class ExitStatus : int {
  ok = 0,
  failed = 1,       // the operation failed; the reason stands on standard error
  usage = 2,        // the command line is wrong
  unreachable = 3,  // no daemon is listening, or it refuses this process
};

}  // namespace tarnel::ctl
