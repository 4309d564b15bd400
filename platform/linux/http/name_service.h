#pragma once

namespace tarnel::detail {

// Loads what looking up host names needs besides text files: the resolver and the modules that
// /etc/nsswitch.conf names for hosts. Afterwards a confined process can look names up without opening
// libraries. What cannot be loaded is left out, as the resolver itself would.
void preloadNameService();

}  // namespace tarnel::detail
