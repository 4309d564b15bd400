#pragma once

#include <cstdint>
#include <string>

#include "base/value.h"

namespace tarnel {

// The platform's record of what costs power. Threads: any.
class PowerLog {
 public:
  PowerLog() = default;
  PowerLog(const PowerLog&) = delete;
  PowerLog& operator=(const PowerLog&) = delete;
  virtual ~PowerLog() = default;

  // The registered-event call: records that the client of that number saw the event, with what the dictionary
  // says about it. Nobody passes anything in `extra` yet. A record that cannot be kept is logged as lost.
  virtual void logRegisteredEvent(int32_t client, const std::string& eventName, const Dictionary& dictionary,
                                  const MaybeDictionary& extra) = 0;
};

}  // namespace tarnel
