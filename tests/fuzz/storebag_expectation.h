#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/value.h"
#include "util/process_values.h"

namespace tarnel::fuzz {

// What a storebag says for an environment, found without the code under test. Points into the storebag.
struct StorebagExpectation {
  const Dictionary* section = nullptr;
  const std::string* version = nullptr;
  std::optional<int32_t> refreshCycle;  // held to a day
};

StorebagExpectation storebagExpectation(const Dictionary& storebag, EnvironmentType environment);

}  // namespace tarnel::fuzz
