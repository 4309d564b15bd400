#pragma once

#include <cstddef>
#include <cstdint>

// Memory that runs out when a test says so. A program that lists failing_memory.cc among its sources has the
// allocation of the whole program replaced; it is one of its own.

namespace tarnel::test {

// From now on this thread's allocations of so many bytes and more throw std::bad_alloc.
void failAllocationsFrom(size_t bytes) noexcept;
inline void failNoAllocations() noexcept {
  failAllocationsFrom(SIZE_MAX);
}

}  // namespace tarnel::test
