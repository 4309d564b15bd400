#pragma once

#include <memory>

#include "backends/tarnel_backend.h"

namespace tarnel {

// Records messages as events of the platform's power log, when its own, unflagged send is called. Sessions
// call the flagged one, which is the base's and does nothing here: the power log, which others on the device
// read, holds only what code records there by name, and no client can fill it with messages.
//
// Threads: the owning session's.
class VesmerBackend final : public TarnelBackend {
 private:
  struct Private {};  // construction goes through initWithName

 public:
  // initWithName:profile:productFamily:
  static std::shared_ptr<VesmerBackend> initWithName(const Dependencies& dependencies,
                                                     const std::string& name, const MaybeDictionary& profile,
                                                     const MaybeString& productFamily);
  VesmerBackend(Private, const Dependencies& dependencies, const std::string& name,
                const MaybeDictionary& profile, const MaybeString& productFamily);

  using TarnelBackend::sendMessage;
  // sendMessage:timestamp:method:respCode:eventID:
  // An operation of its own, told from the flagged ones by the type of its last argument. Records the payload
  // with "method", "respCode" and "event" set in it, unless the method is 0 or the payload has no entries.
  // Never returns anything.
  MaybeSentObject sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp, Method method,
                              RespCode respCode, EventID eventID);
};

}  // namespace tarnel
