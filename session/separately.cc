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

Error reportFailure(Log& log, const char* operation, const char* who) {
  std::string why = currentFailure();
  TARNEL_LOG(log, error, "%s: %s failed: %s", operation, who, why.c_str());
  return {kTarnelErrorDomain, -1, std::move(why)};
}

}  // namespace tarnel
