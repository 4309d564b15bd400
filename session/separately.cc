#include "session/separately.h"

#include <exception>
#include <string>

#include "tarnel/keys.h"

namespace tarnel {
namespace {

// Only while an exception is handled.
std::string currentFailure() {
  try {
    throw;
  } catch (const std::exception& failure) {
    return failure.what();
  } catch (...) {
    return "unknown failure";
  }
}

}  // namespace

void logFailure(Log& log, const char* operation, const char* who) noexcept {
  try {
    TARNEL_LOG(log, error, "%s: %s failed: %s", operation, who, currentFailure().c_str());
  } catch (...) {
    return;  // there is nobody else to tell
  }
}

Error reportFailure(Log& log, const char* operation, const char* who) {
  logFailure(log, operation, who);
  return {kTarnelErrorDomain, -1, currentFailure()};
}

}  // namespace tarnel
