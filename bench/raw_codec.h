#pragma once

#include <optional>
#include <span>

#include "base/value.h"

namespace tarnel::bench {

// The cheapest way to carry a payload that still yields the same dictionary: lengths, tags and little-endian
// numbers in a row, nothing described, nothing aligned. It bounds what any transport could cost; nobody
// speaks it.
Data encodeRaw(const Dictionary& dictionary);

// Nothing when the bytes are cut off or hold an unknown tag.
std::optional<Dictionary> decodeRaw(std::span<const uint8_t> bytes);

}  // namespace tarnel::bench
