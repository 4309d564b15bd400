#pragma once

#include <stdlib.h>

#include <cstdint>
#include <ctime>
#include <string>

// Time zones of a test's own, so that none need be installed.

namespace tarnel {

// What the file of a zone says that is always so many seconds east of GMT (RFC 8536, version 1).
inline std::string zoneText(int32_t secondsEast) {
  const auto number = [](int64_t value) {
    std::string bytes;
    for (int shift = 24; shift >= 0; shift -= 8) bytes += static_cast<char>((value >> shift) & 0xFF);
    return bytes;
  };
  constexpr char kName[] = "XST";
  std::string text = "TZif" + std::string(16, '\0');
  // Indicators, leap seconds and transitions: none; one kind of local time, and the bytes of its name.
  for (const int32_t count : {0, 0, 0, 0, 1, static_cast<int32_t>(sizeof(kName))}) text += number(count);
  return text + number(secondsEast) + std::string(2, '\0') + std::string(kName, sizeof(kName));
}

// The same for whole hours, with a second block for times of 64 bits and the rule for the time to come (RFC
// 8536, version 2).
inline std::string longZoneText(int32_t secondsEast) {
  std::string block = zoneText(secondsEast);
  block[4] = '2';
  const int32_t west = -secondsEast / 3600;
  return block + block + "\nXST" + std::to_string(west) + "\n";
}

// Makes this process take the file for the system's zone.
inline void loadZoneFrom(const std::string& path) {
  // The C library reads the file of an unchanged TZ once only.
  ::unsetenv("TZ");
  ::tzset();
  ::setenv("TZ", (":" + path).c_str(), 1);
  ::tzset();
}

}  // namespace tarnel
