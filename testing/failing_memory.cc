#include "testing/failing_memory.h"

#include <cstdlib>
#include <new>

namespace {

thread_local size_t smallestThatFails = SIZE_MAX;

}  // namespace

void* operator new(size_t size) {
  if (size >= smallestThatFails) throw std::bad_alloc();
  if (void* memory = std::malloc(size == 0 ? 1 : size)) return memory;
  throw std::bad_alloc();
}
void operator delete(void* memory) noexcept {
  std::free(memory);
}
void operator delete(void* memory, size_t /*size*/) noexcept {
  std::free(memory);
}

namespace tarnel::test {

void failAllocationsFrom(size_t bytes) noexcept {
  smallestThatFails = bytes;
}

}  // namespace tarnel::test
