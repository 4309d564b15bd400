#pragma once

#include <span>
#include <string>
#include <string_view>

#include "base/value.h"
#include "tests/fuzz/fuzz_target.h"

// Values out of an input's bytes.

namespace tarnel::fuzz {

// Words that mean something to the code under test; texts and keys are often one of them.
using Words = std::span<const std::string_view>;

// One of the words, or any text.
std::string readText(InputReader& input, Words words);
// Containers are nested at most `depth` deep. Nothing more than null comes from an input that is used up.
Value readValue(InputReader& input, Words words, int depth = 5);
Dictionary readDictionary(InputReader& input, Words words, int depth = 5);
Array readArray(InputReader& input, Words words, int depth = 5);
// Absent for one input byte in four.
MaybeDictionary readMaybeDictionary(InputReader& input, Words words, int depth = 5);

}  // namespace tarnel::fuzz
