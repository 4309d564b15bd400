#pragma once

#include <exception>
#include <memory>
#include <new>
#include <type_traits>
#include <vector>

#include "base/value.h"
#include "client/src/outcome.h"
#include "client/src/session_core.h"
#include "tarnel/tarnel_c_session.h"

// What the C interface is made with: handles, replies, and a wall against exceptions.

struct tarnel_session {
  std::shared_ptr<tarnel::core::SessionCore> core;
};

namespace tarnel::core {

// The handles of values are the values' own addresses.
inline Dictionary* unwrap(tarnel_dictionary* handle) {
  return reinterpret_cast<Dictionary*>(handle);
}
inline const Dictionary* unwrap(const tarnel_dictionary* handle) {
  return reinterpret_cast<const Dictionary*>(handle);
}
inline Array* unwrap(tarnel_array* handle) {
  return reinterpret_cast<Array*>(handle);
}
inline const Array* unwrap(const tarnel_array* handle) {
  return reinterpret_cast<const Array*>(handle);
}
inline const Value* unwrap(const tarnel_value* handle) {
  return reinterpret_cast<const Value*>(handle);
}
inline const tarnel_dictionary* wrap(const Dictionary* value) {
  return reinterpret_cast<const tarnel_dictionary*>(value);
}
inline const tarnel_array* wrap(const Array* value) {
  return reinterpret_cast<const tarnel_array*>(value);
}
inline const tarnel_value* wrap(const Value* value) {
  return reinterpret_cast<const tarnel_value*>(value);
}

// Keeps the message for tarnel_last_error() and returns the status.
tarnel_status report(tarnel_status status, const char* message) noexcept;
inline tarnel_status report(const Outcome& outcome) noexcept {
  return outcome.ok() ? TARNEL_OK : report(outcome.status, outcome.message.c_str());
}

// Runs `body`, which returns an Outcome; what it throws becomes a status.
template <class Body>
tarnel_status guarded(Body body) noexcept {
  try {
    return report(body());
  } catch (const std::bad_alloc&) {
    return report(TARNEL_ERROR_SYSTEM, "memory is short");
  } catch (const std::exception& error) {
    return report(TARNEL_ERROR_SYSTEM, error.what());
  }
}

// A tarnel_reply that shows an answer. The answer is kept by reference unless it is moved in.
class ReplyView {
 public:
  explicit ReplyView(const Answer& answer);
  const tarnel_reply& reply() const { return reply_; }

 private:
  std::vector<const char*> names_;
  tarnel_reply reply_{};
};

// A reply that the caller owns.
struct OwnedReply : tarnel_reply {
  explicit OwnedReply(Answer held);
  const Answer answer;
  const ReplyView view;
};

}  // namespace tarnel::core
