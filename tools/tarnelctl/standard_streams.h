#pragma once

#include <unistd.h>

#include <iostream>
#include <ostream>
#include <string_view>

#include "base/log.h"
#include "tools/tarnelctl/terminal.h"
#include "tools/tarnelctl/visible_output.h"

namespace tarnel::ctl {

// Errors of the settings store are told by the commands; what it logs beside them goes to standard error.
class StandardErrorLog final : public Log {
 public:
  explicit StandardErrorLog(const Terminal& terminal) : terminal_(terminal) {}

 protected:
  void write(LogLevel /*level*/, std::string_view text) override {
    terminal_.err << "tarnelctl: " << text << '\n';
  }

 private:
  const Terminal& terminal_;
};

// Standard output and standard error; on a terminal nothing that is printed can steer it.
struct StandardStreams {
  // An answer that came before an error is also shown before it.
  StandardStreams() { err.tie(&out); }
  StandardStreams(const StandardStreams&) = delete;
  StandardStreams& operator=(const StandardStreams&) = delete;

  const bool outIsTerminal = isatty(STDOUT_FILENO) == 1;
  const bool errIsTerminal = isatty(STDERR_FILENO) == 1;
  VisibleOutput visibleOut{*std::cout.rdbuf()};
  VisibleOutput visibleErr{*std::cerr.rdbuf()};
  std::ostream out{outIsTerminal ? &visibleOut : std::cout.rdbuf()};
  std::ostream err{errIsTerminal ? &visibleErr : std::cerr.rdbuf()};
};

}  // namespace tarnel::ctl
