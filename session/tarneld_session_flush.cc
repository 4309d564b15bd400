// A flush of all backends, joined into one reply.

#include <cstddef>
#include <memory>
#include <utility>

#include "session/separately.h"
#include "session/tarneld_session.h"
#include "tarnel/keys.h"
#include "util/message_log.h"

namespace tarnel {
namespace {

constexpr char kNoBackends[] = "No backends available to send message";

// What the callbacks of one flush share. Outlives the session: answers may be late.
class FlushJoin {
 public:
  FlushJoin(const Dependencies& dependencies, size_t backends, FlushCompletion completion)
      : dependencies_(dependencies), remaining_(backends), completion_(std::move(completion)) {}

  // On any thread, once per backend. The first error is the answer, else what the last backend says.
  void backendFlushed(const std::string& name, MaybeString text, MaybeError error) {
    TARNEL_LOG(dependencies_.log, debug, "internalFlushMessagesWithCompletion: %s", name.c_str());
    if (text) writeToLogFile(dependencies_, "[%s -> flushMessages] %s", name.c_str(), text->c_str());
    const LockGuard guard(TarneldSession::classLock());
    if (remaining_ > 0) --remaining_;
    if (error || remaining_ == 0) completion_(std::move(text), std::move(error));
  }

 private:
  const Dependencies& dependencies_;
  size_t remaining_;            // under the class lock
  FlushCompletion completion_;  // under the class lock; empty once it was called
};

}  // namespace

void TarneldSession::flushMessagesWithCompletion(FlushReply completion) {
  TARNEL_LOG(dependencies_.log, debug, "flushMessagesWithCompletion: Flushing messages for session %u",
             sessionID());
  internalFlushMessagesWithCompletion(std::move(completion));
}

void TarneldSession::internalFlushMessagesWithCompletion(FlushCompletion completion) {
  const BackendSet& backends = currentBackends();
  if (backends.empty()) {
    TARNEL_LOG(dependencies_.log, debug, "internalFlushMessagesWithCompletion: %s", kNoBackends);
    completion(std::nullopt, Error(kTarnelErrorDomain, -1, kNoBackends));
    return;
  }
  const auto join = std::make_shared<FlushJoin>(dependencies_, backends.size(), std::move(completion));
  for (const auto& [name, backend] : backends) {
    MaybeError failure =
        separately(dependencies_.log, "internalFlushMessagesWithCompletion", name.c_str(),
                   [&join, &name = name, &each = *backend] {
                     each.flushMessagesWithCompletion([join, key = name](MaybeString text, MaybeError error) {
                       join->backendFlushed(key, std::move(text), std::move(error));
                     });
                   });
    // It will not answer any more. If it had, this is an error after the fact: the first of all answers.
    if (failure) join->backendFlushed(name, std::nullopt, std::move(failure));
  }
}

}  // namespace tarnel
