#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace tarnel {

// The current locale and time zone. Threads: any.
class LocaleInformation {
 public:
  LocaleInformation() = default;
  LocaleInformation(const LocaleInformation&) = delete;
  LocaleInformation& operator=(const LocaleInformation&) = delete;
  virtual ~LocaleInformation() = default;

  // ISO 3166 country code of the locale's territory ("DE"); nothing when the locale names none.
  virtual std::optional<std::string> countryCode() = 0;
  // The local time zone's offset from GMT in seconds, east positive, at that time (seconds since 1970).
  virtual int32_t secondsFromGMT(int64_t time) = 0;
};

}  // namespace tarnel
