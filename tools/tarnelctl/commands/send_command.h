#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

#include "base/value.h"
#include "tarnel/tarnel.h"
#include "tools/tarnelctl/terminal.h"

// `tarnelctl send` and `tarnelctl single`: one message to the daemon.

namespace tarnel::ctl {

struct SendOptions {
  std::string socketPath;  // empty: the library's default
  int32_t clientType = 0;
  uint32_t sessionID = 1;
  uint16_t clientVersion = 1;
  std::string clientName;  // with either name given, the session has user info and requires it
  std::string serviceName;
  std::vector<std::string> userInfo;  // more KEY=VALUE pairs of the user info
  bool batch = false;
  uint16_t category = 0;
  uint16_t type = 0;
  std::vector<std::string> payload;  // KEY=VALUE pairs; none: no payload
  uint32_t flag = 0;                 // 0 to 3; send only
  bool flush = false;                // send only
  bool json = false;
  std::chrono::milliseconds timeout{30'000};  // for each answer
};

// A session with this one message: configure, start, send, perhaps flush, finish.
ExitStatus sendMessage(const SendOptions& options, const Terminal& terminal);
// The message with its session info in one call.
ExitStatus sendSingleMessage(const SendOptions& options, const Terminal& terminal);

// What the library is told of them.
client::Options sessionOptions(const SendOptions& options);
// A session of the options, and its configuring and start; what that showed goes into `json` where it is
// wanted. Not ok: the command ends with it.
client::Session makeSession(const SendOptions& options);
ExitStatus startSession(client::Session& session, const SendOptions& options, Dictionary& json,
                        const Terminal& terminal);

}  // namespace tarnel::ctl
