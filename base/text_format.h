#pragma once

#include <string>

namespace tarnel {

// The text that printf would print.
__attribute__((format(printf, 1, 2))) std::string formatText(const char* format, ...);

}  // namespace tarnel
