#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <string_view>

#include "base/log.h"
#include "base/value.h"
#include "formats/cryptography.h"
#include "platform/device_information.h"
#include "platform/random.h"
#include "platform/settings_store.h"

namespace tarnel {

// The environment whose section of a storebag applies.
enum class EnvironmentType : uint32_t {
  none = 0,
  development = 1,
  orvaneInternal = 2,
  seed = 3,
  release = 4
};

// Values that are computed once, on first use, and hold for the life of the process: later changes of the
// settings or the device are not seen. Threads: any.
class ProcessValues {
 public:
  // Kept by reference; must outlive this object.
  ProcessValues(Log& log, DeviceInformation& deviceInformation, SettingsStore& settings, Random& random);

  // True when the device's "ReleaseType" equals "Internal".
  bool isInternalBuild();
  // Setting "environmentType", else 2 on an internal build and 3 elsewhere.
  EnvironmentType currentEnvironmentType();
  // Setting "tarnel_storebag_url"; nothing when it is not set.
  const MaybeString& storebagURLOverride();
  // A random UUID text.
  const std::string& processLifetimeIdentifier();
  // A UUID text that is the same whenever the same name is given, for any number of names: it is their digest
  // with a secret of this process, so that nothing is kept for each, and none can be told from another.
  std::string processLifetimeIdentifier(std::string_view name);
  // Held while a persistent identifier is made, so that two sessions asking at once get the same one.
  [[nodiscard]] std::unique_lock<std::mutex> lockIdentifierCreation();

 private:
  EnvironmentType userDefaultsEnvironment();

  Log& log_;
  DeviceInformation& deviceInformation_;
  SettingsStore& settings_;
  Random& random_;
  std::mutex identifierCreation_;
  std::once_flag internalBuildOnce_;
  std::once_flag environmentOnce_;
  std::once_flag storebagURLOnce_;
  std::once_flag lifetimeIdentifierOnce_;
  std::once_flag secretOnce_;
  bool internalBuild_ = false;
  EnvironmentType environment_ = EnvironmentType::none;
  MaybeString storebagURL_;
  std::string lifetimeIdentifier_;
  Data secret_;
};

// Domain of the daemon's own settings.
inline constexpr char kTarnelSettingsDomain[] = "com.orvane.tarnel";

}  // namespace tarnel
