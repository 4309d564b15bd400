#include "tools/tarnelctl/progress_bar.h"

#include <algorithm>
#include <ostream>
#include <string>

namespace tarnel::ctl {
namespace {

constexpr size_t kWidth = 40;
constexpr std::chrono::milliseconds kPause{100};

}  // namespace

ProgressBar::ProgressBar(const Terminal& terminal, size_t total, bool quiet)
    : screen_(terminal.screen != nullptr ? *terminal.screen : terminal.err),
      total_(total),
      shown_(terminal.errIsTerminal && !quiet && total != 0) {}

ProgressBar::~ProgressBar() {
  if (shown_) screen_ << "\r\x1b[K" << std::flush;
}

void ProgressBar::update(size_t done) {
  const auto now = std::chrono::steady_clock::now();
  if (!shown_ || (now < next_ && done != total_)) return;
  next_ = now + kPause;
  draw(done);
}

void ProgressBar::draw(size_t done) {
  const size_t filled = std::min(kWidth, done * kWidth / total_);
  screen_ << "\r[" << std::string(filled, '#') << std::string(kWidth - filled, '.') << "] " << done << '/'
          << total_ << std::flush;
}

}  // namespace tarnel::ctl
