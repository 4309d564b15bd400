#pragma once

#include "base/types.h"
#include "base/value.h"

namespace tarnel {

// The message that tells where uploaded log records are.
struct LogDataAnnouncement {
  // Without a location there is nothing to tell, and the payload is empty.
  explicit LogDataAnnouncement(const MaybeString& location) {
    if (location) payload.set("LogDataUploadLocation", *location);
  }

  Dictionary payload;
  Method method{0};
  RespCode respCode{2};
  Flag flag = Flag::normal;
};

}  // namespace tarnel
