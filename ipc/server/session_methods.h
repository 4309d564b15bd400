#pragma once

#include <cstdint>
#include <memory>
#include <span>
#include <string>

#include "base/error.h"
#include "base/log.h"
#include "base/unique_fd.h"
#include "ipc/protocol/client_session_interface.h"
#include "ipc/server/client_file_registry.h"
#include "ipc/server/connection_link.h"

struct sd_bus_message;

namespace tarnel {

struct SendCall;

// One call of the session's interface, as it came.
struct SessionCall {
  sd_bus_message* message;
  ClientSessionInterface& session;
  const std::shared_ptr<ConnectionLink>& link;
  uint64_t serial;
  const std::string& peer;
  Log& log;
  ClientFileRegistry* clientFiles;       // null: none are taken
  uint32_t uid;                          // the client's user
  std::span<UniqueFd> descriptors = {};  // that came with it; a method takes them by moving
  uint32_t descriptorIndex = 0;          // if there are any: which of them the last argument names
};

// Decodes the arguments and calls the session's operation; its reply answers the call, from any thread.
// Returns what to answer at once instead: an unknown method, or arguments that are not right. Lets through
// what the session throws. On the connection's thread.
MaybeError callSessionMethod(const SessionCall& call);

// The same for a call that was read already.
void runSendCall(const SessionCall& call, SendCall sendCall);

// The session's interface as introspection describes it.
std::string describeSessionInterface();

}  // namespace tarnel
