#pragma once

#include <mutex>
#include <string>
#include <vector>

#include "base/log.h"
#include "platform/linux/configuration/configuration.h"

namespace tarnel {

// Writes what is wrong with a file that is read again and again, but only when that has changed.
// Threads: any.
class OnceLog {
 public:
  // `routine` begins each text. `log` is kept by reference.
  OnceLog(std::string routine, Log& log) : routine_(std::move(routine)), log_(log) {}

  // The problems of one reading; none clears the memory, so that a new mistake is told again.
  void report(const std::vector<ConfigurationProblem>& problems) {
    std::string all;
    for (const auto& problem : problems) all += problem.text + "\n";
    {
      const std::lock_guard guard(mutex_);
      if (all == last_) return;
      last_ = all;
    }
    for (const auto& problem : problems) {
      log_.log(problem.level, "%s: %s", routine_.c_str(), problem.text.c_str());
    }
  }

 private:
  const std::string routine_;
  Log& log_;
  std::mutex mutex_;
  std::string last_;
};

}  // namespace tarnel
