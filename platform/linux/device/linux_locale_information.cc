#include "platform/linux/device/linux_locale_information.h"

#include <sys/stat.h>

#include <cerrno>
#include <ctime>
#include <utility>

#include "platform/file_system.h"

namespace tarnel {

namespace {

std::optional<std::string> countryFromEnvironment(const LinuxLocaleInformation::Environment& environment) {
  for (const char* variable : {"LC_ALL", "LC_MEASUREMENT", "LANG"}) {
    const char* name = environment(variable);
    if (name != nullptr && *name != '\0') return territoryOfLocale(name);
  }
  return std::nullopt;
}

// A link that leads nowhere is there.
bool isThere(const std::string& path) {
  struct stat status {};
  return ::lstat(path.c_str(), &status) == 0 || errno != ENOENT;
}

// Why the C library could not make a zone of the file.
MaybeError zoneProblem(const std::string& path) {
  const auto contents = readFile(path);
  if (!contents) return contents.error();
  if (contents->text.starts_with("TZif")) return std::nullopt;  // RFC 8536, section 3.1
  return Error(kFileErrorDomain, EINVAL, path + ": is no time zone");
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
                                               const Environment& environment, Log& log, LocalZone zone)
    : country_(configuredCountry ? std::move(configuredCountry) : countryFromEnvironment(environment)),
      isZoneFixed_(environment("TZ") != nullptr),
      zone_(std::move(zone)),
      log_(log),
      loaded_(fileIdentity(zone_.file)) {
  zone_.load();
}

// The identity is taken before the file is loaded: what changes in between shows at the next question.
void LinuxLocaleInformation::followZone() {
  const std::lock_guard guard(mutex_);
  const auto current = fileIdentity(zone_.file);
  if (current == loaded_) return;
  if (isThere(zone_.file)) {
    if (const auto problem = zoneProblem(zone_.file)) {
      if (!std::exchange(isTold_, true)) {
        TARNEL_LOG(log_, warning,
                   "LinuxLocaleInformation(secondsFromGMT): the time zone has changed, but %s; the zone of "
                   "before stays. Let the daemon read the file, also in its sandbox's profile, or restart it",
                   problem->localizedDescription().c_str());
      }
      return;
    }
  }
  isTold_ = false;
  zone_.load();
  loaded_ = current;
}

int32_t LinuxLocaleInformation::secondsFromGMT(int64_t time) {
  if (!isZoneFixed_) followZone();
  const auto moment = static_cast<time_t>(time);
  std::tm local{};
  // localtime_r does not look at the zone's file again, and costs a fraction of a microsecond.
  if (::localtime_r(&moment, &local) == nullptr) return 0;
  return static_cast<int32_t>(local.tm_gmtoff);
}

}  // namespace tarnel
