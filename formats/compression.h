#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/log.h"

namespace tarnel {

enum class CompressionFormat { zlib, gzip };  // RFC 1950, RFC 1952

// Compresses the whole input at zlib's default level. Nothing on failure (also for empty input), logged.
// Threads: any.
std::optional<std::string> compressDataWithZlibOrGzip(Log& log, CompressionFormat format,
                                                      std::string_view input);

std::optional<std::string> gzipDeflate(Log& log, std::string_view input);

}  // namespace tarnel
