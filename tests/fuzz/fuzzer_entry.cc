#include <cstddef>
#include <cstdint>

#include "tests/fuzz/fuzz_target.h"

// What libFuzzer calls.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  tarnel::fuzz::runOne({data, size});
  return 0;
}
