#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace tarnel {

// Cuts a client's bytes into the authentication's lines and messages, so far as to know how large each
// message claims to be, before anything is held for it. What the bytes mean is the bus library's business.
class InputFramer {
 public:
  // A message of more than `maxMessageBytes` is refused as soon as its fixed header is there.
  explicit InputFramer(size_t maxMessageBytes) : maxMessageBytes_(maxMessageBytes) {}

  // How many of these bytes, which follow those admitted before, may be handed on. Fewer than given when the
  // last ones are a part of a fixed header: give them again with what follows. Nothing when the input is
  // refused; why is then in refusal().
  std::optional<size_t> admit(std::string_view bytes);
  const std::string& refusal() const noexcept { return refusal_; }

  // Messages that were admitted to their last byte.
  uint64_t completed() const noexcept { return completed_; }

 private:
  size_t admitAuthentication(std::string_view bytes);
  // False when refused.
  bool beginMessage(std::string_view header);

  const size_t maxMessageBytes_;
  bool authenticating_ = true;
  std::string line_;          // of the authentication, as far as it matters
  size_t restOfMessage_ = 0;  // bytes of the current message that are still to come
  uint64_t completed_ = 0;
  std::string refusal_;
};

}  // namespace tarnel
