#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <utility>

namespace tarnel::detail {

// A counted pointer to a value that is shared until somebody writes to it.
//
// std::shared_ptr cannot serve here: its use_count() is a relaxed read, so "I am the only owner" would not
// order the writes that follow it after the last reads of an owner on another thread.
//
// Threads: distinct CowPtr objects may be used from distinct threads, also when they share their value.
template <class T>
class CowPtr {
 public:
  CowPtr() noexcept = default;
  CowPtr(const CowPtr& other) noexcept : box_(other.box_) {
    if (box_ != nullptr) box_->owners.fetch_add(1, std::memory_order_relaxed);
  }
  CowPtr(CowPtr&& other) noexcept : box_(std::exchange(other.box_, nullptr)) {}
  CowPtr& operator=(CowPtr other) noexcept {
    std::swap(box_, other.box_);
    return *this;
  }
  ~CowPtr() { drop(); }

  // The value for reading; null while nothing was ever written.
  const T* get() const noexcept { return box_ == nullptr ? nullptr : &box_->value; }
  bool sharesValueWith(const CowPtr& other) const noexcept { return box_ == other.box_; }

  // The value for writing: made when there is none, copied first when it is shared.
  T& write() {
    if (box_ == nullptr) {
      box_ = std::make_unique<Box>().release();
    } else if (box_->owners.load(std::memory_order_acquire) != 1) {
      Box* copy = std::make_unique<Box>(box_->value).release();
      drop();
      box_ = copy;
    }
    return box_->value;
  }

 private:
  struct Box {
    Box() = default;
    explicit Box(const T& from) : value(from) {}
    T value;
    std::atomic<uint32_t> owners{1};
  };

  void drop() noexcept {
    if (box_ != nullptr && box_->owners.fetch_sub(1, std::memory_order_acq_rel) == 1) {
      const std::unique_ptr<Box> last(box_);
    }
    box_ = nullptr;
  }

  Box* box_ = nullptr;
};

}  // namespace tarnel::detail
