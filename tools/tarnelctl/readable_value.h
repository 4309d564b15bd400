#pragma once

#include <string>

#include "base/value.h"

namespace tarnel::ctl {

// The value for people, with its end of line: each element of a list behind a dash and each entry of a
// dictionary behind its key, on lines of their own; text in quotes, dates in UTC, data in hexadecimal, its
// first bytes when there are many. Control characters in text and keys, and those that turn the direction of
// writing, are shown as \u001b and the like, so that nothing of it steers a terminal.
std::string readableText(const Value& value);

}  // namespace tarnel::ctl
