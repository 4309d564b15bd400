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

  // Until the peer's line that ends the authentication.
  bool isAuthenticating() const noexcept { return authenticating_; }
  // While authenticating: how many of these bytes belong to the authentication. Nothing when there are too
  // many.
  std::optional<size_t> admitAuthentication(std::string_view bytes);
  // True when the next byte begins a message.
  bool isBetweenMessages() const noexcept { return !authenticating_ && restOfMessage_ == 0; }
  // Bytes of the message begun that were not admitted yet.
  size_t restOfMessage() const noexcept { return restOfMessage_; }
  // Between messages: the size of the one that begins with these bytes, 0 while they are too few to tell.
  // Nothing when it is refused.
  std::optional<size_t> sizeOfNext(std::string_view bytes);
  // Between messages: the next one is not handed on at all; it counts as admitted.
  void passMessage() noexcept { ++completed_; }

  // Messages that were admitted to their last byte.
  uint64_t completed() const noexcept { return completed_; }

 private:
  const size_t maxMessageBytes_;
  bool authenticating_ = true;
  std::string line_;  // of the authentication
  size_t authenticationBytes_ = 0;
  size_t restOfMessage_ = 0;  // bytes of the current message that are still to come
  uint64_t completed_ = 0;
  std::string refusal_;
};

}  // namespace tarnel
