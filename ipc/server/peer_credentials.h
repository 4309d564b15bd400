#pragma once

#include "ipc/entitlements.h"

namespace tarnel {

// The kernel's record of who connected this Unix stream socket (SO_PEERCRED), and a handle on that process
// (SO_PEERPIDFD) where the kernel gives one. A descriptor that is no Unix socket, or is not
// connected, gives credentials that no rule grants anything. The socket is only looked at, not kept.
//
// /proc is read later, only when a rule asks for the executable or the unit, and only counts when the
// process still lives after the reading: a number that went to another process proves nothing.
//
// Threads: any.
PeerCredentials readPeerCredentials(int socket);

}  // namespace tarnel
