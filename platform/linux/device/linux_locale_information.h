#pragma once

#include <ctime>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "base/file_access.h"
#include "base/log.h"
#include "platform/locale_information.h"

namespace tarnel {

// The territory of a locale's name: "DE" of "de_DE.UTF-8@euro"; nothing for "C", "POSIX", a name without a
// territory, or one that is no ISO 3166 code of two letters.
std::optional<std::string> territoryOfLocale(std::string_view name);

// The file of the local time zone, and what makes the C library read it when it has changed. A test has its
// own.
struct LocalZone {
  std::string file = "/etc/localtime";
  std::function<void()> load = ::tzset;
};

// The country comes from the configuration, else from the first of LC_ALL, LC_MEASUREMENT and LANG that is
// set and not empty.
//
// The time zone is that of TZ, as it is when the object is made; without TZ the system's, whose changes are
// followed: each question looks whether another file stands at the place of the zone's (one system call). The
// object must be made before the process confines itself. A file that cannot be used afterwards, because the
// sandbox's profile does not cover it or because it is no zone or only the beginning of one, changes nothing:
// the C library alone would go on in UTC. One warning tells of it. No file at all means UTC, as localtime(5)
// has it.
class LinuxLocaleInformation final : public LocaleInformation {
 public:
  using Environment = std::function<const char*(const char* name)>;

  // `log` is kept by reference.
  LinuxLocaleInformation(std::optional<std::string> configuredCountry, const Environment& environment,
                         Log& log, LocalZone zone = {});

  std::optional<std::string> countryCode() override { return country_; }
  int32_t secondsFromGMT(int64_t time) override;

 private:
  void followZone();

  const std::optional<std::string> country_;
  const bool isZoneFixed_;
  const LocalZone zone_;
  Log& log_;
  std::mutex mutex_;
  std::optional<FileIdentity> loaded_;  // guarded by mutex_; nothing: there was no file
  bool isTold_ = false;                 // guarded by mutex_; that the file cannot be used
};

}  // namespace tarnel
