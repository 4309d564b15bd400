#include "util/process_values.h"

#include <algorithm>
#include <optional>

#include "util/device_facts.h"

namespace tarnel {
namespace {

constexpr uint64_t kEnvironmentTypes = 5;  // 0 to 4

// A number, or a text that is read as one; nothing for everything else.
std::optional<uint64_t> environmentNumber(Log& log, const Value& value) {
  if (value.isNumber()) return value.uint64Value();
  TARNEL_LOG(log, warning,
             "userDefaultsEnvironment: 'environmentType' of %s should be a number from 0 to 4, not %s",
             kTarnelSettingsDomain, value.description().c_str());
  if (value.string() != nullptr) return value.uint64Value();
  return std::nullopt;
}

}  // namespace

ProcessValues::ProcessValues(Log& log, DeviceInformation& deviceInformation, SettingsStore& settings)
    : log_(log), deviceInformation_(deviceInformation), settings_(settings) {}

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
  std::optional<uint64_t> stored;
  if (const auto value = settings_.objectForKey(kTarnelSettingsDomain, "environmentType")) {
    stored = environmentNumber(log_, *value);
  }
  EnvironmentType environment = EnvironmentType::orvaneInternal;
  if (!stored) {
    if (!isInternalBuild()) environment = EnvironmentType::seed;
  } else if (*stored >= kEnvironmentTypes) {  // unsigned: negative numbers are too large
    TARNEL_LOG(log_, error, "userDefaultsEnvironment: Invalid environment type %u",
               static_cast<unsigned>(std::min<uint64_t>(*stored, UINT32_MAX)));
  } else {
    environment = static_cast<EnvironmentType>(*stored);
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

}  // namespace tarnel
