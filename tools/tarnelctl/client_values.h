#pragma once

#include "base/value.h"
#include "tarnel/tarnel.h"
#include "tools/tarnelctl/terminal.h"

// From the values that documents are read into to those of the client library.

namespace tarnel::ctl {

client::Dictionary toClient(const Dictionary& dictionary);
client::Array toClient(const Array& array);

// Prints why a call failed; what the program then exits with.
ExitStatus reportFailure(const client::Status& status, const Terminal& terminal);

}  // namespace tarnel::ctl
