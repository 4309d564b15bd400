#pragma once

namespace tarnel {

// Blocks of this size, in bytes, and beyond are large: the largest files that are uploaded. What is smaller,
// such as the body of a post, is kept for the next one of its kind.
inline constexpr int kLargeBlockBytes = 4 << 20;

// Lets large blocks of memory go back to the system as soon as they are freed. Left to itself the C library
// keeps blocks of up to 32 MiB once it has seen some, separately for each thread that had any: with a thread
// for each connection that is many times what is in use. Of smaller blocks it keeps at most 8 MiB at the end
// of each of its heaps, of which several threads share one.
//
// False where the C library has no such setting; nothing else depends on it.
// Threads: any; for the whole process, once at its start.
[[nodiscard]] bool returnLargeBlocks();

}  // namespace tarnel
