#pragma once

#include <cstddef>

#include "base/value.h"

// About how many bytes values take on the wire; for bounding what waits to be sent and what is kept.

namespace tarnel::wire {

size_t approximateSize(const Value& value);
size_t approximateSize(const Dictionary& dictionary);
size_t approximateSize(const Array& array);
size_t approximateSize(const MaybeDictionary& dictionary);

}  // namespace tarnel::wire
