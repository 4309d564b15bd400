#include "platform/linux/system/heap_memory.h"

#include <malloc.h>

namespace tarnel {

bool returnLargeBlocks() {
#if defined(M_MMAP_THRESHOLD) && defined(M_TRIM_THRESHOLD)
  // Setting one of the two also ends the growth of the other. Left at what the library begins with, 128 KiB,
  // the second would have the heap shrink after every batch of events and grow again with the next one.
  constexpr int kTopBytes = 8 << 20;
  return ::mallopt(M_MMAP_THRESHOLD, kLargeBlockBytes) != 0 && ::mallopt(M_TRIM_THRESHOLD, kTopBytes) != 0;
#else
  return false;
#endif
}

}  // namespace tarnel
