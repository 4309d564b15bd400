#include "platform/linux/linux_locale_information.h"

#include <ctime>
#include <utility>

namespace tarnel {

namespace {

std::optional<std::string> countryFromEnvironment(const LinuxLocaleInformation::Environment& environment) {
  for (const char* variable : {"LC_ALL", "LC_MEASUREMENT", "LANG"}) {
    const char* name = environment(variable);
    if (name != nullptr && *name != '\0') return territoryOfLocale(name);
  }
  return std::nullopt;
}

}  // namespace

std::optional<std::string> territoryOfLocale(std::string_view name) {
  name = name.substr(0, name.find_first_of(".@"));
  const size_t underscore = name.find('_');
  if (underscore == std::string_view::npos || underscore == 0) return std::nullopt;
  const std::string_view territory = name.substr(underscore + 1);
  if (territory.size() != 2) return std::nullopt;
  for (const char letter : territory) {
    if (letter < 'A' || letter > 'Z') return std::nullopt;
  }
  return std::string(territory);
}

LinuxLocaleInformation::LinuxLocaleInformation(std::optional<std::string> configuredCountry,
                                               const Environment& environment)
    : country_(configuredCountry ? std::move(configuredCountry) : countryFromEnvironment(environment)) {
  ::tzset();
}

int32_t LinuxLocaleInformation::secondsFromGMT(int64_t time) {
  const auto moment = static_cast<time_t>(time);
  std::tm local{};
  // localtime_r does not look at the zone's file again, and costs a fraction of a microsecond.
  if (::localtime_r(&moment, &local) == nullptr) return 0;
  return static_cast<int32_t>(local.tm_gmtoff);
}

}  // namespace tarnel
