#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "util/storebag.h"

// The request for a storebag and the check of its answer. Only storebag.cc and the tests use these.

namespace tarnel::detail {

// What fetchStorebagWithName reports beside its result; see StorebagFetchSlots.
struct StorebagNameFetchSlots {
  int32_t& maxAge;
  bool& notModified;
  MaybeString* lastModified;
};

// The whole verified document, or the built-in one; nothing on failure and when not modified.
std::optional<Dictionary> fetchStorebagWithName(const Dependencies& dependencies, const MaybeString& name,
                                                StorebagNameFetchSlots slots);

// The document that stands in for "calvisto" while its server cannot be reached.
Dictionary fallbackStorebag();

// Maximum age in seconds that the answer's Cache-Control states, held to 32 bits; the longest time where it
// states none. The value is split at "=" and blanks alone, so "no-cache,max-age=600" does not count; the
// document's own "refresh_cycle" goes before it.
int32_t maxAgeOfResponse(const HttpResponse* response);

// The text as it can stand in a request: bytes that no URL may hold are percent-encoded, all else stays.
std::string urlForRequest(std::string_view text);

// True for text that can stand as a header field's value and is no longer than kMaxLastModifiedLength.
bool isUsableLastModified(std::string_view value);
inline constexpr size_t kMaxLastModifiedLength = 1024;

}  // namespace tarnel::detail
