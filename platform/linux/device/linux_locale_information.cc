#include "platform/linux/device/linux_locale_information.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdint>
#include <ctime>
#include <string_view>
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

uint64_t numberAt(std::string_view bytes, size_t position) {
  uint64_t number = 0;
  for (const char byte : bytes.substr(position, 4)) number = number << 8U | static_cast<unsigned char>(byte);
  return number;
}

// Bytes of the block that begins here, its header and the data that the header counts; nothing where there
// are fewer. RFC 8536, sections 3.1 and 3.2; timeBytes: 4 in a file's first block, 8 in its second.
std::optional<size_t> blockLength(std::string_view bytes, uint64_t timeBytes) {
  constexpr size_t kHeader = 44;
  if (bytes.size() < kHeader || !bytes.starts_with("TZif")) return std::nullopt;
  const uint64_t utIndicators = numberAt(bytes, 20);
  const uint64_t standardIndicators = numberAt(bytes, 24);
  const uint64_t leapSeconds = numberAt(bytes, 28);
  const uint64_t transitions = numberAt(bytes, 32);
  const uint64_t types = numberAt(bytes, 36);
  const uint64_t nameBytes = numberAt(bytes, 40);
  const uint64_t length = kHeader + transitions * (timeBytes + 1) + types * 6 + nameBytes +
                          leapSeconds * (timeBytes + 4) + standardIndicators + utIndicators;
  return length <= bytes.size() ? std::optional<size_t>(length) : std::nullopt;
}

// False for one that is still being written: the C library takes what it cannot read to its end for UTC.
bool isWholeZone(std::string_view bytes) {
  const auto first = blockLength(bytes, 4);
  if (!first) return false;
  if (bytes[4] == '\0') return true;  // version 1 has this block alone
  bytes.remove_prefix(*first);
  const auto second = blockLength(bytes, 8);
  if (!second) return false;
  const auto footer = bytes.substr(*second);
  return footer.size() >= 2 && footer.starts_with('\n') && footer.ends_with('\n');
}

// Why the C library could not make a zone of the file.
MaybeError zoneProblem(const std::string& path) {
  const auto contents = readFile(path);
  if (!contents) return contents.error();
  if (!contents->text.starts_with("TZif")) return Error(kFileErrorDomain, EINVAL, path + ": is no time zone");
  if (isWholeZone(contents->text)) return std::nullopt;
  return Error(kFileErrorDomain, EINVAL, path + ": is a time zone's file cut short");
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
  if (current == loaded_) {
    isTold_ = false;  // another file that cannot be used is told anew
    return;
  }
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
