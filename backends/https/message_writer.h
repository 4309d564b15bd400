#pragma once

#include <optional>
#include <string>

#include "base/log.h"
#include "base/value.h"
#include "platform/clock.h"

namespace tarnel {

// Writes the JSON message that carries events. It holds what that needs of a backend as values, so that
// messages of a flush can be written when the backend is gone.
//
// Threads: any, one at a time. Log and clock must outlive it.
struct MessageWriter {
  Log& log;
  Clock& clock;
  MaybeString clientId;  // absent: the message has no events
  bool mayMakePretty;    // whether an indented copy may be made for the log

  // The body; nothing when it cannot be written. The events are changed: dates become numbers, what may not
  // stand in an event goes. `pretty` (may be null) gets an indented copy where one may be made, else it stays
  // as it is.
  std::optional<std::string> write(Array& events, MaybeString* pretty) const;
};

}  // namespace tarnel
