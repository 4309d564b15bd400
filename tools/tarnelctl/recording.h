#pragma once

#include <cstddef>
#include <cstdint>
#include <istream>
#include <string>
#include <vector>

#include "base/error.h"
#include "base/value.h"

// Recorded sessions: NDJSON, one record a line; examples/README.md describes the format.

namespace tarnel::ctl {

inline constexpr char kRecordingErrorDomain[] = "TarnelRecordingErrorDomain";

struct RecordedSession {
  std::string label;
  Dictionary sessionInfo;
  MaybeDictionary userInfo;
  Array frameworks;
  bool aggregates = false;
};

struct RecordedStep {
  enum class Kind { message, flush, finish, close };

  size_t session = 0;  // position in Recording::sessions
  double at = 0;       // seconds since the recording's start
  Kind kind = Kind::message;
  uint16_t category = 0;  // these four of messages only
  uint16_t type = 0;
  MaybeDictionary payload;
  uint32_t flag = 0;
};

struct Recording {
  std::vector<RecordedSession> sessions;  // in the order in which they start
  std::vector<RecordedStep> steps;
};

// Reads at most maxBytes bytes. An error's text begins with "line N: " and names what is wrong there.
Result<Recording> readRecording(std::istream& input, size_t maxBytes = size_t{512} << 20U);

}  // namespace tarnel::ctl
