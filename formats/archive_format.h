#pragma once

#include <cstdint>
#include <string_view>

// The words of the archive format; docs/keyed-archive.md.

namespace tarnel {

inline constexpr std::string_view kArchiveMark = "\xD9\xD9\xF7";  // CBOR's own, tag 55799
inline constexpr uint64_t kArchiveVersion = 1;
inline constexpr std::string_view kArchiveVersionKey = "version";
inline constexpr std::string_view kArchiveRootKey = "root";
inline constexpr std::string_view kArchiveObjectsKey = "objects";
inline constexpr std::string_view kArchiveKeysKey = "keys";
inline constexpr std::string_view kArchiveValuesKey = "values";

}  // namespace tarnel
