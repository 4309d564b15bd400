#pragma once

#include <memory>
#include <string>

#include "tools/tarnelctl/journal.h"

namespace tarnel::ctl {

// The journal whose files lie in `directory`, or this machine's when that is empty. Null when it cannot be
// opened; then `error` is a negative errno.
std::unique_ptr<Journal> openSystemJournal(const std::string& directory, int& error);

}  // namespace tarnel::ctl
