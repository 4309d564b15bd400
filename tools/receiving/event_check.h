#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include "base/value.h"
#include "tools/receiving/http_message.h"

// Whether a post is as the service sends it. Findings are plain sentences; an event is named by its place
// in the post ("event 3", counted from 1). Threads: any.

namespace tarnel::lab {

// At most kLimit sentences; the last of them says how many more there were.
class Problems {
 public:
  static constexpr size_t kLimit = 20;

  void add(std::string problem);
  std::vector<std::string> take();

 private:
  std::vector<std::string> list_;
  size_t more_ = 0;
};

struct PostMessage {
  MaybeString clientId;
  Value postTime;
  Array events;
};

// The message {"postTime", "clientId", "events"}; what is missing or of a wrong type is a problem and left
// out.
PostMessage readMessage(const Value& document, Problems& problems);

// Standard fields with their types and ranges, and that nothing but texts and numbers stands in an event.
void checkEvent(const Value& event, size_t number, Problems& problems);

struct BodyFacts {
  size_t wireBytes;
  size_t plainBytes;
  bool gzip;
};

// The service's header fields, by themselves and against the message.
void checkHeaders(const NameValues& headers, const PostMessage& message, const BodyFacts& body,
                  Problems& problems);

}  // namespace tarnel::lab
