#include "util/storebag.h"

#include <algorithm>

#include "util/storebag_internal.h"

namespace tarnel {
namespace {

constexpr char kPublicServer[] = "https://" TARNEL_PUBLIC_STOREBAG_HOST "/bags/alder";
constexpr char kInternalServer[] = "https://" TARNEL_INTERNAL_STOREBAG_HOST "/storebags/alder";

const char* nameOfClientType(int32_t clientType) {
  switch (clientType) {
    case 5:
      return "plexor";
    case 6:
    case 14:
    case 15:
      return "vandor";
    case 7:
    case 11:
    case 13:
      return "calvisto";
    case 8:
      return "brevan";
    case 9:
      return "moldaro";
    case 10:
      return "quintar";
    case 12:
      return "pelmora";
    case 16:
      return "ostrik";
    case 17:
      return "frandel";
    default:
      return nullptr;
  }
}

// Null for `none`, which selects no section.
const char* sectionName(EnvironmentType environment) {
  switch (environment) {
    case EnvironmentType::development:
      return "development";
    case EnvironmentType::orvaneInternal:
      return "orvane_internal";
    case EnvironmentType::seed:
      return "seed";
    case EnvironmentType::release:
      return "release";
    case EnvironmentType::none:
      break;
  }
  return nullptr;
}

// A verified document may still hold values of the wrong kind; they count as absent.
void logIgnored(Log& log, const Dictionary& storebag, const char* key, const char* expected) {
  if (!storebag.contains(key)) return;
  TARNEL_LOG(log, warning, "fetchStorebagForEnvironmentAndClientType: ignoring '%s': expected a %s", key,
             expected);
}

const Dictionary* section(Log& log, const Dictionary& storebag, const char* name) {
  const auto* found = findDictionary(storebag, name);
  if (found == nullptr) logIgnored(log, storebag, name, "dictionary");
  return found;
}

const Dictionary* sectionForEnvironment(Log& log, const Dictionary& storebag, EnvironmentType environment) {
  const char* name = sectionName(environment);
  if (name == nullptr) return nullptr;
  const auto* found = section(log, storebag, name);
  if (found == nullptr && environment == EnvironmentType::seed) {
    TARNEL_LOG(log, warning,
               "fetchStorebagForEnvironmentAndClientType: Seed section is missing in the storebag.");
    found = section(log, storebag, "release");
  }
  return found;
}

std::string requiredVersion(Log& log, const Dictionary& storebag) {
  if (const auto* version = findString(storebag, "version")) return *version;
  logIgnored(log, storebag, "version", "string");
  throw InvalidArgument("fetchStorebagForEnvironmentAndClientType: the storebag has no version");
}

void applyRefreshCycle(Log& log, const Dictionary& storebag, int32_t& maxAge) {
  const auto* value = findNumber(storebag, "refresh_cycle");
  if (value == nullptr) {
    logIgnored(log, storebag, "refresh_cycle", "number");
    return;
  }
  maxAge = std::min(value->boundedInt32Value(), kStorebagMaxAgeSeconds);
  TARNEL_LOG(log, information, "fetchStorebagForEnvironmentAndClientType: Store bag override MaxAge=%d",
             maxAge);
}

}  // namespace

MaybeString storebagNameForClientType(int32_t clientType) {
  const char* name = nameOfClientType(clientType);
  return name == nullptr ? MaybeString() : MaybeString(name);
}

std::string storebagServerURL(const Dependencies& dependencies) {
  if (const auto& override = dependencies.process.storebagURLOverride()) return *override;
  return dependencies.process.isInternalBuild() ? kInternalServer : kPublicServer;
}

std::optional<Dictionary> fetchStorebagForEnvironmentAndClientType(const Dependencies& dependencies,
                                                                   int32_t clientType,
                                                                   StorebagFetchSlots slots) {
  Log& log = dependencies.log;
  // The agent lets no type without a name come here; others than 0 would be asked for as "(null)".
  if (clientType == 0) {
    TARNEL_LOG(log, error,
               "fetchStorebagForEnvironmentAndClientType: Could not find storebag name for client type %d",
               clientType);
    return std::nullopt;
  }
  const auto storebag = detail::fetchStorebagWithName(
      dependencies, storebagNameForClientType(clientType),
      {.maxAge = slots.maxAge, .notModified = slots.notModified, .lastModified = slots.lastModified});
  if (!storebag) {
    if (!slots.notModified) {
      TARNEL_LOG(log, error,
                 "fetchStorebagForEnvironmentAndClientType: Could not fetch storebag for client type %d",
                 clientType);
    }
    return std::nullopt;
  }
  const auto environment = dependencies.process.currentEnvironmentType();
  const auto* found = sectionForEnvironment(log, *storebag, environment);
  if (found == nullptr) {
    const char* name = sectionName(environment);
    TARNEL_LOG(log, error,
               // clang-format off
               "fetchStorebagForEnvironmentAndClientType: Could not find storebag for client type %d with %s environment",
               // clang-format on
               clientType, name == nullptr ? "(null)" : name);
    return std::nullopt;
  }
  slots.version = requiredVersion(log, *storebag);
  applyRefreshCycle(log, *storebag, slots.maxAge);
  return *found;
}

}  // namespace tarnel
