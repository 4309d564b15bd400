#pragma once

#include <utility>

#include "base/error.h"
#include "base/log.h"

namespace tarnel {

// For the catch block of separately: logs what was caught, "OPERATION: WHO failed: ...", at level 3. Returns
// it as an error of kTarnelErrorDomain with code -1.
Error reportFailure(Log& log, const char* operation, const char* who);

// Takes one of several steps that stand alone, such as the same with each backend: what this one throws ends
// it and is logged, and the others are taken all the same. Returns the failure, if there was one.
//
// operation, who: for the log; who took the step.
template <class Step>
MaybeError separately(Log& log, const char* operation, const char* who, Step step) {
  try {
    std::move(step)();
    return std::nullopt;
  } catch (...) {
    return reportFailure(log, operation, who);
  }
}

}  // namespace tarnel
