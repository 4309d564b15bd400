#pragma once

#include "tests/fuzz/session_world.h"

namespace tarnel::fuzz {

// A session behind the reading end of a real connection: the rest of the input is what a client writes to its
// socket, raw or as messages of which only the contents come from the input.
void runBytes(SessionWorld& world, InputReader& input, bool isFramed);

}  // namespace tarnel::fuzz
