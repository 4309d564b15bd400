#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

// Texts for people and for HTTP. Threads: any.

namespace tarnel::lab {

// What strangers sent, fit for a terminal and for JSON: control characters and bytes that are no UTF-8
// become "?", and what goes beyond maxBytes is cut and marked with "...".
std::string printable(std::string_view text, size_t maxBytes = 200);

std::string grouped(uint64_t number);   // "12,345"
std::string byteCount(uint64_t bytes);  // "812 B", "3.4 kB", "1.2 MB"
std::string clockTime(double seconds);  // local time of day, "14:03:07.123"; seconds since 1970
std::string lowerCased(std::string_view text);

// IMF-fixdate (RFC 9110 section 5.6.7), "Fri, 20 Nov 2026 11:40:52 GMT", from and to seconds since 1970.
std::string httpDate(int64_t seconds);
std::optional<int64_t> parseHttpDate(std::string_view text);

// A whole number without sign or anything else around it.
std::optional<uint64_t> parseNumber(std::string_view text);

// 1-based line of a byte offset; offsets behind the end count as the end.
size_t lineOfOffset(std::string_view text, size_t offset);

}  // namespace tarnel::lab
