#pragma once

#include <array>
#include <cstdint>
#include <string>

namespace tarnel {

using UuidBytes = std::array<uint8_t, 16>;

// Canonical 36-character text, upper case: "8-4-4-4-12" hexadecimal digits (RFC 4122 section 3). Threads:
// any.
std::string uuidText(const UuidBytes& uuid);

}  // namespace tarnel
