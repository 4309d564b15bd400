#include "tests/fuzz/storebag_expectation.h"

#include <algorithm>
#include <cmath>

namespace tarnel::fuzz {

StorebagExpectation storebagExpectation(const Dictionary& storebag, EnvironmentType environment) {
  StorebagExpectation expected;
  switch (environment) {
    case EnvironmentType::development:
      expected.section = findDictionary(storebag, "development");
      break;
    case EnvironmentType::orvaneInternal:
      expected.section = findDictionary(storebag, "orvane_internal");
      break;
    case EnvironmentType::seed:
      expected.section = findDictionary(storebag, "seed");
      if (expected.section == nullptr) expected.section = findDictionary(storebag, "release");
      break;
    case EnvironmentType::release:
      expected.section = findDictionary(storebag, "release");
      break;
    case EnvironmentType::none:
      break;
  }
  expected.version = findString(storebag, "version");
  if (const auto* cycle = findNumber(storebag, "refresh_cycle")) {
    const double seconds = cycle->type() == Value::Type::unsignedInteger ? 1e18 : cycle->doubleValue();
    expected.refreshCycle =
        std::isnan(seconds) ? 0
                            : static_cast<int32_t>(std::clamp(std::trunc(seconds), -2147483648.0, 86400.0));
  }
  return expected;
}

}  // namespace tarnel::fuzz
