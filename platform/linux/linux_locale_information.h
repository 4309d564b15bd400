#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "platform/locale_information.h"

namespace tarnel {

// The territory of a locale's name: "DE" of "de_DE.UTF-8@euro"; nothing for "C", "POSIX", a name without a
// territory, or one that is no ISO 3166 code of two letters.
std::optional<std::string> territoryOfLocale(std::string_view name);

// The country comes from the configuration, else from the first of LC_ALL, LC_MEASUREMENT and LANG that is
// set and not empty. The time zone is the system's (or TZ's) as it is when the object is made, which must be
// before the process confines itself; changes of the zone's rules over the year are followed.
class LinuxLocaleInformation final : public LocaleInformation {
 public:
  using Environment = std::function<const char*(const char* name)>;

  LinuxLocaleInformation(std::optional<std::string> configuredCountry, const Environment& environment);

  std::optional<std::string> countryCode() override { return country_; }
  int32_t secondsFromGMT(int64_t time) override;

 private:
  const std::optional<std::string> country_;
};

}  // namespace tarnel
