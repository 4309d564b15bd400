#pragma once

#include <cstdint>
#include <string_view>

#include "platform/datagram_socket.h"

namespace tarnel {

// The IPv4 address of dotted text, of which at most 16 bytes are used, and a port. Names are not resolved:
// text that is no address gives the broadcast address, which no socket of ours may connect to. The classic
// forms with fewer than four numbers, and octal and hexadecimal ones, are taken. Threads: any.
Ipv4Address socketAddress(std::string_view dottedText, uint16_t port);

}  // namespace tarnel
