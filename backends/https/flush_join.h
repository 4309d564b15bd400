#pragma once

#include <cstddef>
#include <mutex>
#include <optional>
#include <utility>

#include "backends/tarnel_backend.h"

namespace tarnel {

// Several posts that are completed as one flush: after the last answer, with the first error that came.
//
// Threads: any; the completion runs on the thread that reports last.
class FlushJoin {
 public:
  explicit FlushJoin(FlushCompletion completion) : completion_(std::move(completion)) {}

  // Before each post, until allExpected.
  void expectOne() {
    const std::lock_guard guard(lock_);
    ++left_;
  }
  // There are no more posts; text is what the completion tells.
  void allExpected(MaybeString text) {
    {
      const std::lock_guard guard(lock_);
      text_ = std::move(text);
    }
    completeOne(std::nullopt);
  }
  void completeOne(MaybeError error) {
    {
      const std::lock_guard guard(lock_);
      if (!error_) error_ = std::move(error);
      if (--left_ > 0) return;
    }
    // Nobody else comes here any more.
    completion_(std::move(text_), std::move(error_));
  }

 private:
  std::mutex lock_;
  size_t left_ = 1;  // posts without an answer, and one for allExpected
  MaybeString text_;
  MaybeError error_;
  FlushCompletion completion_;
};

}  // namespace tarnel
