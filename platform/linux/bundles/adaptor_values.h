#pragma once

#include "base/value.h"

struct tarnel_adaptor_values;
struct tarnel_dictionary;

namespace tarnel {

// The functions with which adaptors read what they are handed. Threads: any.
const tarnel_adaptor_values& adaptorValues() noexcept;

// The dictionary as an adaptor sees it; null for none. Valid as long as the dictionary is.
const tarnel_dictionary* forAdaptor(const MaybeDictionary& dictionary) noexcept;

}  // namespace tarnel
