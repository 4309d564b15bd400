#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "base/error.h"
#include "base/value.h"
#include "ipc/server/session_methods.h"

// Several messages in one call.

namespace tarnel {

struct BatchedMessage {
  uint16_t category = 0;
  uint16_t type = 0;
  uint32_t flag = 0;
  MaybeDictionary payload;
};

// Reads a(qquaa{sv}). All or nothing: no message of a batch runs when one of them cannot be read.
Result<std::vector<BatchedMessage>> readBatch(sd_bus_message* message);

// Sends the messages in order and answers the call when each has been answered. A message whose send fails,
// or lets go of its reply, is answered with an error in its place; the others go on.
void runBatch(const SessionCall& call, std::vector<BatchedMessage> messages);

// About how many bytes an answer takes.
size_t answerBytes(const MaybeSentObject& sent);

}  // namespace tarnel
