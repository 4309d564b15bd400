#pragma once

#include <functional>
#include <string>
#include <string_view>

#include "base/error.h"

namespace tarnel::lab {

// Unpacks one or more gzip members (RFC 1952) that make up the whole input; at most maxBytes come out.
// The error says what is wrong. Threads: any.
Result<std::string> gunzip(std::string_view input, size_t maxBytes);

// The same, piece by piece: what the sink takes is never held. An error of the sink ends it.
MaybeError gunzipTo(std::string_view input, uint64_t maxBytes,
                    const std::function<MaybeError(std::string_view)>& sink);

}  // namespace tarnel::lab
