#pragma once

#include <string>
#include <string_view>

namespace tarnel {

// The text as it may stand in the query of a URL: the characters that RFC 3986 allows there are kept
// (letters, digits and -._~!$&'()*+,;=:@/?), every other byte becomes %XX with capital digits. An ampersand
// or an equals sign is not encoded. Threads: any.
std::string percentEncodedForQuery(std::string_view text);

}  // namespace tarnel
