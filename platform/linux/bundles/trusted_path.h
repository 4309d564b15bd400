#pragma once

#include <string>

#include "base/error.h"

namespace tarnel {

// Nothing when the absolute path leads to a regular file that nobody but root and this process's user can
// change, replace or move: the file and every directory from the root down belong to one of the two and are
// writable by nobody else (a sticky directory is writable by others), and no part of the path is a symbolic
// link. Whoever opens the path afterwards therefore opens what was checked.
//
// Else why not: ENOENT or ENOTDIR when a part is missing, EPERM for what is refused, with the remedy, or the
// errno of what failed. Domain kFileErrorDomain. Threads: any.
MaybeError checkTrustedPath(const std::string& path);

}  // namespace tarnel
