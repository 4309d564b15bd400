#pragma once

#include "platform/clock.h"
#include "tools/lab/receivers/misbehaviour.h"
#include "tools/receiving/arrival_store.h"
#include "tools/receiving/http_message.h"

namespace tarnel::lab {

// Takes in event posts: unpacks, checks, stores, answers. Threads: any.
class PostReceiver {
 public:
  static constexpr size_t kMaxPlainBytes = 16U << 20U;

  // All outlive the receiver.
  PostReceiver(ArrivalStore& store, Misbehaviours& misbehaviours, Clock& clock)
      : store_(store), misbehaviours_(misbehaviours), clock_(clock) {}

  // 200 with {"received": events, "problems": [...]}; 400 when the body is no message at all, 413 when it
  // is too large, 415 when it is packed in another way than gzip.
  HttpAnswer receive(const HttpRequest& request);

 private:
  ArrivalStore& store_;
  Misbehaviours& misbehaviours_;
  Clock& clock_;
};

}  // namespace tarnel::lab
