#pragma once

#include <cstdint>
#include <string_view>

namespace tarnel {

// Name under which a client type (0 to 17) reports; the empty text for any other number.
std::string_view senderName(int32_t compType) noexcept;

}  // namespace tarnel
