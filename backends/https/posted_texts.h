#pragma once

#include <cstddef>
#include <string>
#include <utility>

#include "backends/https/event_batch.h"
#include "base/value.h"

namespace tarnel {

// The texts of posted messages for the log, one after the other, bounded like a batch.
//
// Threads: one at a time.
class PostedTexts {
 public:
  // Where the next text goes; null when no more is taken.
  MaybeString* next() {
    next_.reset();
    return isFull() ? nullptr : &next_;
  }
  // The message is posted: what was put into next() is a part of the text.
  void take() {
    if (isFull()) {
      ++leftOut_;
    } else if (next_) {
      if (all_) all_->append("\n").append(*next_);
      if (!all_) all_ = std::move(next_);
      next_.reset();
    }
  }
  // So far.
  const MaybeString& text() const noexcept { return all_; }
  // At the end.
  MaybeString result() {
    if (leftOut_ != 0) all_->append("\n(and " + std::to_string(leftOut_) + " more messages)");
    return std::move(all_);
  }

 private:
  bool isFull() const noexcept { return all_ && all_->size() >= EventBatch::kMaxBytes; }

  MaybeString all_;
  MaybeString next_;
  size_t leftOut_ = 0;
};

}  // namespace tarnel
