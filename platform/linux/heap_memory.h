#pragma once

namespace tarnel {

// Lets large blocks of memory, such as a file that is uploaded, go back to the system as soon as they are
// freed. Left to itself the C library keeps them once it has seen some, separately for each thread that had
// any: with a thread for each connection that is many times what is in use.
//
// Threads: any; for the whole process, once at its start.
void returnLargeBlocks();

}  // namespace tarnel
