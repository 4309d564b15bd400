#pragma once

#include <chrono>
#include <cstddef>
#include <iosfwd>

#include "tools/tarnelctl/terminal.h"

namespace tarnel::ctl {

// One line on the terminal that grows with the work; nothing where standard error is no terminal. It is
// redrawn ten times a second at most and wiped when the bar goes.
class ProgressBar {
 public:
  ProgressBar(const Terminal& terminal, size_t total, bool quiet);
  ProgressBar(const ProgressBar&) = delete;
  ProgressBar& operator=(const ProgressBar&) = delete;
  ~ProgressBar();

  void update(size_t done);

 private:
  void draw(size_t done);

  std::ostream& screen_;
  const size_t total_;
  const bool shown_;
  std::chrono::steady_clock::time_point next_{};
};

}  // namespace tarnel::ctl
