#include "backends/https/list_matching.h"

#include <algorithm>
#include <string>

#include "base/text_case.h"

namespace tarnel {
namespace {

template <class Matches>
bool matchList(const MaybeTextList& list, const MaybeString& wholeString, bool whitelist, Matches matches) {
  if (!list || list->empty()) return whitelist;
  if (!wholeString) return !whitelist;
  const std::string folded = foldCase(*wholeString);
  return std::any_of(list->begin(), list->end(),
                     [&folded, &matches](std::string_view item) { return matches(folded, item); });
}

}  // namespace

bool matchExactStringWithList(const MaybeTextList& list, const MaybeString& wholeString, bool whitelist) {
  return matchList(list, wholeString, whitelist, equalsFolded);
}

bool matchStringWithList(const MaybeTextList& list, const MaybeString& wholeString, bool whitelist) {
  return matchList(list, wholeString, whitelist, [](std::string_view folded, std::string_view item) {
    return !item.empty() && folded.find(foldCase(item)) != std::string_view::npos;
  });
}

TextList splitAtCommas(std::string_view text) {
  TextList parts;
  for (;;) {
    const auto comma = text.find(',');
    parts.push_back(text.substr(0, comma));
    if (comma == std::string_view::npos) return parts;
    text.remove_prefix(comma + 1);
  }
}

}  // namespace tarnel
