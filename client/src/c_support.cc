#include "client/src/c_support.h"

#include <cstdio>
#include <utility>

#include "tarnel/tarnel_c_types.h"

namespace tarnel::core {
namespace {

// Plain memory, so that it can be used until a thread's very end.
thread_local char lastError[512] = "";

}  // namespace

tarnel_status report(tarnel_status status, const char* message) noexcept {
  std::snprintf(lastError, sizeof lastError, "%s", message);
  return status;
}

ReplyView::ReplyView(const Answer& answer) {
  reply_.size = sizeof reply_;
  reply_.status = answer.outcome.status;
  reply_.message = answer.outcome.message.c_str();
  if (answer.names) {
    for (const std::string& name : *answer.names) names_.push_back(name.c_str());
    reply_.name_count = names_.size();
    names_.push_back(nullptr);
    reply_.names = names_.data();
  }
  if (answer.text) reply_.text = answer.text->c_str();
  reply_.success = answer.success;
  if (answer.error) {
    reply_.error_domain = answer.error->domain().c_str();
    reply_.error_code = answer.error->code();
    reply_.error_description = answer.error->localizedDescription().c_str();
  }
}

OwnedReply::OwnedReply(Answer held) : tarnel_reply(), answer(std::move(held)), view(answer) {
  static_cast<tarnel_reply&>(*this) = view.reply();
}

}  // namespace tarnel::core

extern "C" {

const char* tarnel_status_name(tarnel_status status) {
#define TARNEL_CASE(name) \
  case name:              \
    return #name
  switch (status) {
    TARNEL_CASE(TARNEL_OK);
    TARNEL_CASE(TARNEL_ERROR_INVALID_ARGUMENT);
    TARNEL_CASE(TARNEL_ERROR_TOO_LARGE);
    TARNEL_CASE(TARNEL_ERROR_QUEUE_FULL);
    TARNEL_CASE(TARNEL_ERROR_NO_DAEMON);
    TARNEL_CASE(TARNEL_ERROR_REFUSED);
    TARNEL_CASE(TARNEL_ERROR_INTERRUPTED);
    TARNEL_CASE(TARNEL_ERROR_CLOSED);
    TARNEL_CASE(TARNEL_ERROR_TIMED_OUT);
    TARNEL_CASE(TARNEL_ERROR_NO_REPLY);
    TARNEL_CASE(TARNEL_ERROR_DAEMON);
    TARNEL_CASE(TARNEL_ERROR_PROTOCOL);
    TARNEL_CASE(TARNEL_ERROR_WRONG_THREAD);
    TARNEL_CASE(TARNEL_ERROR_FORKED);
    TARNEL_CASE(TARNEL_ERROR_SYSTEM);
    TARNEL_CASE(TARNEL_ERROR_FILE);
    default:
      return "unknown";
  }
#undef TARNEL_CASE
}

const char* tarnel_last_error(void) {
  return tarnel::core::lastError;
}

const char* tarnel_version(void) {
  return TARNEL_CLIENT_VERSION;
}

void tarnel_reply_destroy(tarnel_reply* reply) {
  const std::unique_ptr<tarnel::core::OwnedReply> owned(static_cast<tarnel::core::OwnedReply*>(reply));
}

}  // extern "C"
