#pragma once

#include <utility>

#include "base/error.h"
#include "base/log.h"

namespace tarnel {

// For a catch block: logs what was caught, "OPERATION: WHO failed: ...", at level 3. A log that fails itself,
// as one without memory does, says nothing.
void logFailure(Log& log, const char* operation, const char* who) noexcept;

// The same, and returns what was caught as an error of kTarnelErrorDomain with code -1.
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

// The same where nothing may be thrown, as at the end of an object: nobody is told of a failure but the log.
template <class Step>
void separatelyNoexcept(Log& log, const char* operation, const char* who, Step step) noexcept {
  try {
    std::move(step)();
  } catch (...) {
    logFailure(log, operation, who);
  }
}

}  // namespace tarnel
