#pragma once

#include <concepts>
#include <cstddef>
#include <memory>
#include <type_traits>
#include <utility>

namespace tarnel {

template <class Signature>
class OneShot;

// A reply that is given at most once. It may be empty (the caller wants no answer); calling an empty one,
// or a used one, does nothing. Move-only: whoever holds it owes the answer. What was captured is let go as
// soon as the answer is given, or with the OneShot, so that an IPC reply can notice that none will come.
template <class... Args>
class OneShot<void(Args...)> {
 public:
  OneShot() noexcept = default;
  OneShot(std::nullptr_t) noexcept {}
  template <class F>
  requires(!std::same_as<std::remove_cvref_t<F>, OneShot> && std::invocable<F&, Args...>) OneShot(F callable)
      : call_(std::make_unique<Holder<F>>(std::move(callable))) {}

  OneShot(OneShot&&) noexcept = default;
  OneShot& operator=(OneShot&&) noexcept = default;

  explicit operator bool() const noexcept { return call_ != nullptr; }

  void operator()(Args... args) {
    if (const auto call = std::exchange(call_, nullptr)) call->run(std::forward<Args>(args)...);
  }

 private:
  struct Base {
    Base() = default;
    Base(const Base&) = delete;
    Base& operator=(const Base&) = delete;
    virtual ~Base() = default;
    virtual void run(Args... args) = 0;
  };
  template <class F>
  struct Holder final : Base {
    explicit Holder(F f) : callable(std::move(f)) {}
    void run(Args... args) override { callable(std::forward<Args>(args)...); }
    F callable;
  };

  std::unique_ptr<Base> call_;
};

}  // namespace tarnel
