#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

#include "base/value.h"
#include "ipc/server/message_batch.h"

namespace tarnel {

// The calls that clients make all the time, read straight from their bytes: the bus library takes several
// times as long for the same. Only what is beyond doubt is read so. Everything else, and all that is wrong in
// any way, is left to the library, which answers it.
//
// Threads: any.

struct SendCall {
  enum class Kind { message, dictionary, batch };

  Kind kind = Kind::message;
  uint32_t serial = 0;  // the client's
  bool wantsReply = true;
  std::vector<BatchedMessage> messages;  // one unless it is a batch
  Dictionary dictionary;                 // of a call that sends one

  const char* member() const noexcept;
};

// Bytes of a message's start that tell whether readSendCall may take it.
inline constexpr size_t kSendCallStart = 160;

// A quick look at the first bytes, at least kSendCallStart or the whole message: false when the message is
// certainly for the library.
bool mayBeSendCall(std::string_view start);

// The whole message. Nothing when it is for the library.
std::optional<SendCall> readSendCall(std::string_view message);

}  // namespace tarnel
