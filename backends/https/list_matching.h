#pragma once

#include <optional>
#include <string_view>
#include <vector>

#include "base/value.h"

// Matching a name against a list of a client entry, ignoring case.
//
// Threads: all functions may be called from any thread.

namespace tarnel {

// The views point into the document that holds the list.
using TextList = std::vector<std::string_view>;
using MaybeTextList = std::optional<TextList>;

// matchExactStringWithList:wholeString:whitelist:
// An absent or empty list answers `whitelist` itself: an empty whitelist admits everything, an empty
// blacklist bars nothing. Else an absent string answers the opposite of `whitelist`. Else: whether some item
// equals the string.
bool matchExactStringWithList(const MaybeTextList& list, const MaybeString& wholeString, bool whitelist);

// matchStringWithList:wholeString:whitelist:
// The same, but an item matches when it occurs anywhere in the string. An empty item never matches.
bool matchStringWithList(const MaybeTextList& list, const MaybeString& wholeString, bool whitelist);

// The parts between commas, nothing trimmed; one empty part for the empty text.
TextList splitAtCommas(std::string_view text);

}  // namespace tarnel
