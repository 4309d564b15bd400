#include "platform/linux/heap_memory.h"

#include <malloc.h>

namespace tarnel {

void returnLargeBlocks() {
#ifdef M_MMAP_THRESHOLD
  // What the C library begins with; setting it keeps it from growing with the blocks that are freed.
  constexpr int kLargeBlockBytes = 128 << 10;
  ::mallopt(M_MMAP_THRESHOLD, kLargeBlockBytes);
#endif
}

}  // namespace tarnel
