#pragma once

#include <string>
#include <string_view>

// Comparing text ignoring case. Letters of ASCII, Latin-1, Latin Extended-A, Greek and Cyrillic are folded,
// one character to one of the same length in UTF-8; all else compares as it is. Locales play no part.
//
// Threads: all functions may be called from any thread.

namespace tarnel {

std::string foldCase(std::string_view text);

// `folded` is a text that foldCase returned.
bool equalsFolded(std::string_view folded, std::string_view text);

}  // namespace tarnel
