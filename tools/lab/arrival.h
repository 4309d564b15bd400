#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/base/value.h"
#include "tools/lab/http_message.h"

namespace tarnel::lab {

// One event post as it came, well-formed or not.
struct Arrival {
  uint64_t number = 0;  // counts the posts of this run, from 1
  double arrived = 0;   // seconds since 1970
  std::string path;
  std::string sender;  // address and port
  NameValues headers;  // fit for printing
  MaybeString clientId;
  Value postTime;  // null when absent
  Array events;
  bool gzip = false;
  uint64_t wireBytes = 0;             // of the body
  uint64_t plainBytes = 0;            // unpacked; 0 when it could not be
  std::vector<std::string> problems;  // plain sentences; empty when all is as it should be
  std::string answered;               // "200", "status 503" or what else was done on purpose
};

// Is told of every arrival, in their order. Threads: one call at a time, on any thread.
class ArrivalObserver {
 public:
  ArrivalObserver() = default;
  ArrivalObserver(const ArrivalObserver&) = delete;
  ArrivalObserver& operator=(const ArrivalObserver&) = delete;
  virtual ~ArrivalObserver() = default;
  virtual void arrived(const Arrival& arrival) = 0;
};

// "_method" to the number of its events, in order of the methods.
Dictionary methodCounts(const Array& events);

// {"post", "arrived", "path", "sender", "answered", "headers", "clientId", "postTime", "eventCount",
// "methods", "wireBytes", "plainBytes", "gzip", "problems"} and, when asked for, "events".
Dictionary recordOfPost(const Arrival& arrival, bool withEvents);
// {"post", "arrived", "path", "headers", "clientId", "postTime", "event"}.
Dictionary recordOfEvent(const Arrival& arrival, const Value& event);

}  // namespace tarnel::lab
