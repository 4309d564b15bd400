#pragma once

#include <cstddef>

#include "base/value.h"

namespace tarnel::bench {

// A report as a call's media sends it every second, in the shape of examples/call-recording.ndjson: 25
// fields, about 700 bytes of JSON. The numbers grow and vary with `index`, as those of a running call do, so
// that reports compress no better than real ones.
Dictionary callPayload(size_t index);

// Three fields, about 50 bytes.
Dictionary smallPayload(size_t index);

// Who sends it: the user information of the benchmarks' clients.
Dictionary userInfo(const char* serviceName);

}  // namespace tarnel::bench
