#pragma once

#include <algorithm>
#include <functional>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "base/log.h"

namespace tarnel::fake {

// Keeps every line. Threads: any.
class FakeLog final : public Log {
 public:
  struct Line {
    LogLevel level;
    std::string text;
    friend bool operator==(const Line&, const Line&) = default;
  };

  // Run after each line, with its text; set while nobody writes. May throw, as a log without memory does.
  std::function<void(std::string_view text)> whenWritten;

  std::vector<Line> lines() const {
    const std::lock_guard guard(mutex_);
    return lines_;
  }
  void clear() {
    const std::lock_guard guard(mutex_);
    lines_.clear();
  }
  bool contains(LogLevel level, std::string_view text) const { return count(level, text) != 0; }
  // How often exactly this line was written.
  size_t count(LogLevel level, std::string_view text) const {
    const std::lock_guard guard(mutex_);
    return static_cast<size_t>(std::count_if(lines_.begin(), lines_.end(), [&](const Line& line) {
      return line.level == level && line.text == text;
    }));
  }
  // Lines that begin with the text.
  std::vector<Line> startingWith(std::string_view text) const {
    const std::lock_guard guard(mutex_);
    std::vector<Line> found;
    std::copy_if(lines_.begin(), lines_.end(), std::back_inserter(found),
                 [&](const Line& line) { return line.text.starts_with(text); });
    return found;
  }

 protected:
  void write(LogLevel level, std::string_view text) override {
    {
      const std::lock_guard guard(mutex_);
      lines_.push_back({level, std::string(text)});
    }
    if (whenWritten) whenWritten(text);
  }

 private:
  mutable std::mutex mutex_;
  std::vector<Line> lines_;
};

}  // namespace tarnel::fake
