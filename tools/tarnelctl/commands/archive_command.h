#pragma once

#include <string>

#include "formats/archive.h"
#include "tools/tarnelctl/terminal.h"

// `tarnelctl archive`: what stands in a keyed object archive, the form in which log records are uploaded.

namespace tarnel::ctl {

struct ArchiveOptions {
  std::string file;  // - for standard input
  bool json = false;
};

// Prints the value in the archive, readable or as one text document. What is no archive within the limits
// fails, with what to do about it. `standardInput` is a descriptor, read to its end and left open.
ExitStatus showArchive(const ArchiveOptions& options, int standardInput, const Terminal& terminal,
                       const ArchiveLimits& limits = {});

}  // namespace tarnel::ctl
