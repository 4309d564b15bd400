#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/error.h"
#include "base/one_shot.h"
#include "base/value.h"
#include "tarnel/tarnel_c_types.h"

// What calls of the library come to.

namespace tarnel::core {

// A status of the C interface with the sentence that explains it.
struct [[nodiscard]] Outcome {
  tarnel_status status = TARNEL_OK;
  std::string message;

  bool ok() const noexcept { return status == TARNEL_OK; }
};

inline Outcome failure(tarnel_status status, std::string message) {
  return {status, std::move(message)};
}

// The answer to one call; see tarnel_reply for what is used when.
struct Answer {
  Outcome outcome;
  std::optional<std::vector<std::string>> names;
  MaybeString text;
  bool success = false;
  MaybeError error;
};

using Completion = OneShot<void(const Answer& answer)>;

}  // namespace tarnel::core
