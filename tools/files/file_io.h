#pragma once

#include <sys/types.h>

#include <cstddef>
#include <string>
#include <string_view>
#include <utility>

#include "base/error.h"

// Whole files for the tools. Errors carry kToolErrorDomain and the errno (or -1), and name the path and
// the reason. Threads: any.

namespace tarnel {

inline constexpr char kToolErrorDomain[] = "TarnelToolErrorDomain";

// The contents of a regular file of at most maxBytes bytes; anything else is an error.
Result<std::string> readFile(const std::string& path, size_t maxBytes);
// Replaces the file in one step: a reader sees the old contents or the new, also after a crash.
MaybeError writeFile(const std::string& path, std::string_view bytes, mode_t mode);
// With all missing parents; one that exists is fine.
MaybeError makeDirectory(const std::string& path, mode_t mode);
bool pathExists(const std::string& path);

// "cannot ACTION PATH: REASON" from the given errno.
Error fileError(std::string_view action, const std::string& path, int errorNumber);

}  // namespace tarnel
