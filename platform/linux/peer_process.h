#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tarnel {

// The systemd unit named by the text of /proc/<pid>/cgroup: the outermost .service or .scope of the unified
// hierarchy, which is the system's own unit (a user's units lie below "user@1000.service"); nothing when
// there is none. Threads: any.
std::optional<std::string> unitOfCgroup(std::string_view text);

}  // namespace tarnel
