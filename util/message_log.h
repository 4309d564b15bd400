#pragma once

#include "util/dependencies.h"

namespace tarnel {

// Appends "(DATE) MESSAGE\n" to the message log, a file in the message-log directory: the newest one that is
// not older than a day, or a new one. Files that are expired or superseded are deleted on the way. Failures
// are logged; the message is then lost. A file's age counts from its making, or from the time in its name
// where the file system does not know that.
//
// Threads: any. No lock is taken; calls at the same time may each create or delete a file.
__attribute__((format(printf, 2, 3))) void writeToLogFile(const Dependencies& dependencies,
                                                          const char* format, ...);

}  // namespace tarnel
