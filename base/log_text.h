#pragma once

#include <string>
#include <string_view>

namespace tarnel {

// The text as a log may carry it: on one line, with line ends, control characters and bytes that are no UTF-8
// as escapes ("\n", "\x1b"), so that a client's text cannot pass for a line of ours. A line end at the very
// end is dropped. Beyond 16 KiB the text is cut, and the number of bytes that were cut follows. Threads: any.
std::string escapedForLog(std::string_view text);

}  // namespace tarnel
