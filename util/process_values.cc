#include "util/process_values.h"

#include <algorithm>
#include <optional>

#include "util/device_facts.h"

namespace tarnel {
namespace {

constexpr uint64_t kEnvironmentTypes = 5;  // 0 to 4

// A number, or a text that is read as one; nothing for everything else.
std::optional<uint64_t> environmentNumber(const Value& value) {
  if (value.isNumber() || value.string() != nullptr) return value.uint64Value();
  return std::nullopt;
}

// The number as 32 bits show it: a negative one by its two's complement, one that they cannot hold by the
// nearest that they can.
unsigned shownIn32Bits(const Value& value) {
  if (value.unsignedInteger() != nullptr) return UINT32_MAX;  // above all that are signed
  return static_cast<uint32_t>(std::clamp<int64_t>(value.int64Value(), INT32_MIN, UINT32_MAX));
}

}  // namespace

ProcessValues::ProcessValues(Log& log, DeviceInformation& deviceInformation, SettingsStore& settings,
                             Random& random)
    : log_(log), deviceInformation_(deviceInformation), settings_(settings), random_(random) {}

bool ProcessValues::isInternalBuild() {
  std::call_once(internalBuildOnce_,
                 [this] { internalBuild_ = releaseType(deviceInformation_) == "Internal"; });
  return internalBuild_;
}

EnvironmentType ProcessValues::currentEnvironmentType() {
  std::call_once(environmentOnce_, [this] { environment_ = userDefaultsEnvironment(); });
  return environment_;
}

EnvironmentType ProcessValues::userDefaultsEnvironment() {
  const auto value = settings_.objectForKey(kTarnelSettingsDomain, "environmentType");
  const auto stored = value ? environmentNumber(*value) : std::nullopt;
  const bool isValid = stored && *stored < kEnvironmentTypes;  // unsigned: negative numbers are too large
  if (value && !(isValid && value->isNumber())) {
    TARNEL_LOG(log_, warning,
               "userDefaultsEnvironment: 'environmentType' of %s should be a number from 0 to 4, not %s",
               kTarnelSettingsDomain, value->description().c_str());
  }
  EnvironmentType environment = EnvironmentType::orvaneInternal;
  if (isValid) {
    environment = static_cast<EnvironmentType>(*stored);
  } else if (stored) {
    TARNEL_LOG(log_, error, "userDefaultsEnvironment: Invalid environment type %u", shownIn32Bits(*value));
  } else if (!isInternalBuild()) {
    environment = EnvironmentType::seed;
  }
  TARNEL_LOG(log_, information, "userDefaultsEnvironment: Environment type %u",
             static_cast<unsigned>(environment));
  return environment;
}

const MaybeString& ProcessValues::storebagURLOverride() {
  std::call_once(storebagURLOnce_, [this] {
    const auto value = settings_.objectForKey(kTarnelSettingsDomain, "tarnel_storebag_url");
    if (!value) return;
    if (const auto* text = value->string()) {
      storebagURL_ = *text;
    } else {
      TARNEL_LOG(log_, warning, "storebagServerURL: ignoring 'tarnel_storebag_url' of %s: expected a text",
                 kTarnelSettingsDomain);
    }
  });
  return storebagURL_;
}

const std::string& ProcessValues::processLifetimeIdentifier() {
  std::call_once(lifetimeIdentifierOnce_, [this] { lifetimeIdentifier_ = uuidText(random_.uuid()); });
  return lifetimeIdentifier_;
}

std::string ProcessValues::processLifetimeIdentifier(std::string_view name) {
  std::call_once(secretOnce_, [this] {
    for (int half = 0; half < 2; ++half) {
      const UuidBytes bytes = random_.uuid();
      secret_.insert(secret_.end(), bytes.begin(), bytes.end());
    }
  });
  Data keyed = secret_;
  keyed.insert(keyed.end(), name.begin(), name.end());
  const Sha256Digest digest = sha256(keyed);
  UuidBytes bytes{};
  std::copy_n(digest.begin(), bytes.size(), bytes.begin());
  // Version and variant of a random UUID (RFC 4122 section 4.4), which it must not be told from.
  bytes[6] = static_cast<uint8_t>((bytes[6] & 0x0FU) | 0x40U);
  bytes[8] = static_cast<uint8_t>((bytes[8] & 0x3FU) | 0x80U);
  return uuidText(bytes);
}

std::unique_lock<std::mutex> ProcessValues::lockIdentifierCreation() {
  return std::unique_lock(identifierCreation_);
}

}  // namespace tarnel
