#pragma once

#include <cstddef>

#include "base/value.h"
#include "tests/fuzz/fuzz_target.h"

// What targets do with values.

namespace tarnel::fuzz {

// Equal in kind and content: unlike with ==, not-a-number is the same as itself, and -0.0 is not 0.0. Dates
// may be so many seconds apart.
bool same(const Value& a, const Value& b, double tolerance = 0);

// All values and keys, each as often as it occurs.
size_t countOf(const Value& value);

// Levels of arrays and dictionaries.
size_t depthOf(const Value& value);

// A value of every kind and shape, made of the input; small, and no deeper than `depth`.
Value valueFrom(InputReader& input, size_t depth);

}  // namespace tarnel::fuzz
