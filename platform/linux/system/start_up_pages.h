#pragma once

namespace tarnel {

// Takes the code that ran so far out of the process's memory: most of what a start runs never runs again.
// What is needed after all comes back from the page cache when it is next run. Data is not touched.
//
// Threads: any.
void releaseStartUpPages();

}  // namespace tarnel
