#include "platform/linux/linux_locale_information.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <map>

#include "platform/linux/linux_test_support.h"

namespace tarnel {
namespace {

LinuxLocaleInformation::Environment environment(const std::map<std::string, std::string>& variables) {
  return [variables](const char* name) -> const char* {
    const auto found = variables.find(name);
    return found == variables.end() ? nullptr : found->second.c_str();
  };
}

TEST(LinuxLocaleInformation, TheTerritoryIsTheCountry) {
  EXPECT_EQ(territoryOfLocale("de_DE.UTF-8"), "DE");
  EXPECT_EQ(territoryOfLocale("de_AT@euro"), "AT");
  EXPECT_EQ(territoryOfLocale("pt_BR"), "BR");
  for (const char* name :
       {"", "C", "POSIX", "C.UTF-8", "de", "eo.UTF-8", "es_419", "_DE", "de_de", "sr_RS_x"}) {
    EXPECT_FALSE(territoryOfLocale(name)) << name;
  }
}

TEST(LinuxLocaleInformation, TheFirstVariableThatIsSetDecides) {
  const auto country = [](const std::map<std::string, std::string>& variables) {
    return LinuxLocaleInformation(std::nullopt, environment(variables)).countryCode();
  };
  EXPECT_EQ(country({{"LC_ALL", "en_US.UTF-8"}, {"LC_MEASUREMENT", "de_DE"}, {"LANG", "fr_FR"}}), "US");
  EXPECT_EQ(country({{"LC_ALL", ""}, {"LC_MEASUREMENT", "de_DE"}, {"LANG", "fr_FR"}}), "DE");
  EXPECT_EQ(country({{"LANG", "fr_FR"}}), "FR");
  EXPECT_FALSE(country({{"LC_ALL", "C"}, {"LANG", "fr_FR"}}));
  EXPECT_FALSE(country({}));
}

TEST(LinuxLocaleInformation, TheConfigurationComesFirst) {
  EXPECT_EQ(LinuxLocaleInformation("JP", environment({{"LC_ALL", "en_US"}})).countryCode(), "JP");
}

TEST(LinuxLocaleInformation, TheOffsetFollowsTheZoneOverTheYear) {
  const std::string offsets = runInChild([] {
    ::setenv("TZ", "XST-1XDT,M3.5.0,M10.5.0/3", 1);
    LinuxLocaleInformation locale(std::nullopt, environment({}));
    return std::to_string(locale.secondsFromGMT(1704067200)) + " " +
           std::to_string(locale.secondsFromGMT(1719792000));
  });
  EXPECT_EQ(offsets, "3600 7200");
  const std::string west = runInChild([] {
    ::setenv("TZ", "NST3:30", 1);
    return std::to_string(LinuxLocaleInformation(std::nullopt, environment({})).secondsFromGMT(0));
  });
  EXPECT_EQ(west, "-12600");
}

}  // namespace
}  // namespace tarnel
