#include "session/backend_set.h"

#include "tarnel/keys.h"
#include "util/device_facts.h"

namespace tarnel {
namespace {

// The factory has a line for each name that it does not know; one document must not fill the log with them at
// every session's start.
constexpr size_t kMaxUnknownNames = 256;

// What every backend of one set is told.
struct Identity {
  uint32_t sessionID;
  int32_t clientType;
  uint16_t clientVersion;
  bool requireUserInfo;
  bool batchEvents;
  MaybeString productVersion;
  MaybeString buildVersion;
  MaybeString hardwareType;
  MaybeString productFamily;
  bool isInternal;
  std::string selfVersion;
  TimeValue startTimestamp;
};

const Value& valueOrNull(const Dictionary& dictionary, const char* key) {
  static const Value absent;
  const Value* value = dictionary.find(key);
  return value != nullptr ? *value : absent;
}

Identity readIdentity(const Dependencies& dependencies, const Dictionary& sessionInfo) {
  const TimeValue now = dependencies.clock.timeOfDay();
  DeviceInformation& device = dependencies.deviceInformation;
  return {
      .sessionID = valueOrNull(sessionInfo, kTarnelSessionInfoSessionID).uint32Value(),
      .clientType = valueOrNull(sessionInfo, kTarnelSessionInfoClientType).int32Value(),
      .clientVersion = valueOrNull(sessionInfo, kTarnelSessionInfoClientVersion).uint16Value(),
      .requireUserInfo = valueOrNull(sessionInfo, kTarnelSessionInfoRequireUserInfo).boolValue(),
      .batchEvents = valueOrNull(sessionInfo, kTarnelSessionInfoBatchEvent).boolValue(),
      .productVersion = productVersion(device),
      .buildVersion = buildVersion(device),
      .hardwareType = productType(device),
      .productFamily = deviceName(device),
      .isInternal = dependencies.process.isInternalBuild(),
      .selfVersion = dependencies.clientBundle.version().value_or("8.0"),
      .startTimestamp = now,
  };
}

// The order of these calls is part of the contract with the backends.
void introduce(TarnelBackend& backend, const Identity& identity, const MaybeDictionary& userInfo,
               std::string_view deviceID) {
  backend.setSessionID(identity.sessionID);
  backend.setCompType(identity.clientType);
  backend.setClientVersion(identity.clientVersion);
  backend.setUdid(deviceID);
  backend.setProductVersion(identity.productVersion);
  backend.setBuildVersion(identity.buildVersion);
  backend.setHardwareType(identity.hardwareType);
  backend.setIsInternal(identity.isInternal);
  backend.setRequireUserInfo(identity.requireUserInfo);
  backend.setBatchEvents(identity.batchEvents);
  backend.setUserInfoDict(userInfo);
  backend.setSelfVersion(identity.selfVersion);
  backend.setStartTimestamp(identity.startTimestamp);
}

}  // namespace

void cleanUpEach(Log& log, const BackendSet& backends) noexcept {
  for (const auto& [name, backend] : backends) {
    separatelyNoexcept(log, "cleanup", name.c_str(), [&each = *backend] { each.cleanup(); });
  }
}

std::optional<BackendSet> createBackends(const Dependencies& dependencies, const BackendFactory& factory,
                                         const MaybeDictionary& storebag, const MaybeDictionary& sessionInfo,
                                         const MaybeDictionary& userInfo, std::string_view deviceID) {
  if (!storebag) {
    TARNEL_LOG(dependencies.log, error, "createBackends: Attempted to create backends with nil storebag");
    return std::nullopt;
  }
  if (!sessionInfo) {
    TARNEL_LOG(dependencies.log, error, "createBackends: Attempted to create backends with nil session info");
    return std::nullopt;
  }
  const Identity identity = readIdentity(dependencies, *sessionInfo);
  TemporaryBackends made(dependencies.log);
  size_t unknown = 0;
  for (const auto& [name, profile] : *storebag) {
    if (!TarnelBackend::isBackendName(name) && ++unknown > kMaxUnknownNames) continue;
    auto backend = factory(dependencies, name, profile, identity.productFamily, identity.clientType);
    if (backend == nullptr) continue;
    made.append(name, backend);
    introduce(*backend, identity, userInfo, deviceID);
  }
  if (unknown > kMaxUnknownNames) {
    TARNEL_LOG(
        dependencies.log, error,
        "createBackends: %zu keys of the storebag are no backends, of which only the first %zu are named",
        unknown, kMaxUnknownNames);
  }
  return made.release();
}

}  // namespace tarnel
