#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace tarnel {

// The systemd unit named by the text of /proc/<pid>/cgroup: the outermost .service or .scope of the unified
// hierarchy, which is the system's own unit (a user's units lie below "user@1000.service"); nothing when
// there is none. Threads: any.
std::optional<std::string> unitOfCgroup(std::string_view text);

// Where /proc/<pid>/exe points; nothing when it may not be read or the file was deleted. Threads: any.
std::optional<std::string> executableOfProcess(int32_t pid);

}  // namespace tarnel
