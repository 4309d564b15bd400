#include "session/tarneld_session.h"

#include <utility>

#include "formats/cryptography.h"
#include "session/separately.h"
#include "tarnel/keys.h"
#include "util/device_facts.h"

namespace tarnel {
namespace {

constexpr char kTimeSettingsDomain[] = "com.orvane.timed";
constexpr char kAutomaticTimeZoneKey[] = "TMAutomaticTimeZoneEnabled";

constexpr Method kInternalMethod{0};
constexpr RespCode kStart{0};
constexpr RespCode kStop{1};
constexpr uint16_t kFinishType = 2;

const std::string* displayURLOf(const BackendSet& backends, const char* name) {
  const TarnelBackend* backend = backends.find(name);
  return backend != nullptr && backend->displayURL() ? &*backend->displayURL() : nullptr;
}

}  // namespace

std::shared_ptr<TarneldSession> TarneldSession::initWithSessionDelegate(
    const Dependencies& dependencies, std::shared_ptr<TarneldSessionDelegate> sessionDelegate,
    std::shared_ptr<IpcConnection> connection, BackendFactory backendFactory) {
  return std::make_shared<TarneldSession>(Key(), dependencies, std::move(sessionDelegate),
                                          std::move(connection), std::move(backendFactory));
}

TarneldSession::TarneldSession(Key /*key*/, const Dependencies& dependencies,
                               std::shared_ptr<TarneldSessionDelegate> sessionDelegate,
                               std::shared_ptr<IpcConnection> connection, BackendFactory backendFactory)
    : dependencies_(dependencies),
      backendFactory_(std::move(backendFactory)),
      _sessionDelegate(std::move(sessionDelegate)),
      _connection(std::move(connection)) {
  Log& log = dependencies_.log;
  TARNEL_LOG(log, debug, "initWithSessionDelegate: TarneldSession initWithSessionDelegate:%s",
             _sessionDelegate->description().c_str());
  getUniqueDeviceID(dependencies_.deviceInformation, _deviceid.data(), _deviceid.size());
  _sessionIDString = base64Encode(dependencies_.random.uuid());
  TARNEL_LOG(log, debug, "initWithSessionDelegate: Initialized session with UUID %s",
             _sessionIDString.c_str());
}

TarneldSession::~TarneldSession() {
  dealloc();
}

void TarneldSession::dealloc() noexcept {
  if (std::exchange(ended_, true)) return;
  Log& log = dependencies_.log;
  separatelyNoexcept(log, "dealloc", "the first line", [this, &log] {
    TARNEL_LOG(log, debug, "dealloc: TarneldSession dealloc: %u", sessionID());
  });
  separatelyNoexcept(log, "dealloc", "the stop message", [this] { sendStopMessage(); });
  separatelyNoexcept(log, "dealloc", "the last flush", [this] { flushMessagesWithCompletion(nullptr); });
  separatelyNoexcept(log, "dealloc", "the end of aggregation", [this] { shutdownSessionAggregation(); });
  _sessionInfo.reset();
  setUserInfo(std::nullopt);
  _frameworks.reset();
  cleanUpEach(log, _backends);
  reporting_.replaceBackends({});
  _backends = {};
  _periodicServices.reset();
  _storebagVersion.reset();
  _connection.reset();
  _sessionDelegate.reset();
}

void TarneldSession::sendStopMessage() {
  Dictionary payload;
  if (_storebagVersion) payload.set("StorebagVersion", *_storebagVersion);
  internalSendMessage(payload, dependencies_.clock.timeOfDay(), kInternalMethod, kStop);
}

void TarneldSession::setSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo,
                                    std::optional<Array> frameworksToCheck, bool hasAggregationBlock) {
  const auto* number = sessionInfo ? sessionInfo->find(kTarnelSessionInfoSessionID) : nullptr;
  setSessionID(number != nullptr ? number->uint32Value() : 0);
  TARNEL_LOG(dependencies_.log, debug, "setSessionInfo: Configuring session %u", sessionID());
  const auto* required = sessionInfo ? sessionInfo->find(kTarnelSessionInfoRequireUserInfo) : nullptr;
  if (userInfo && (required == nullptr || !required->boolValue())) {
    TARNEL_LOG(dependencies_.log, warning,
               "setSessionInfo: Configure session: user info provided without requiring it");
  }
  _sessionInfo = std::move(sessionInfo);
  _frameworks = std::move(frameworksToCheck);
  setUserInfo(std::move(userInfo));
  setHasAggregator(hasAggregationBlock);
}

void TarneldSession::setUserInfo(MaybeDictionary userInfo) {
  _userInfo = std::move(userInfo);
  reporting_.setUserInfo(_userInfo);
}

void TarneldSession::startConfigWithCompletionHandler(NamesReply reply) {
  TARNEL_LOG(dependencies_.log, debug,
             "startConfigWithCompletionHandler: Starting configuration for session %u", sessionID());
  const MaybeDictionary storebag = _sessionDelegate->storebagForSession(*this);
  if (!storebag) {
    reply(std::nullopt);
    return;
  }
  setStorebagVersion(_sessionDelegate->storebagVersionForSession(*this));
  createBackendsWithStorebag(storebag);
  updateSessionWithDefaultSessionInfo();
  sendStartMessage();
  reply(fetchReportingStates());
}

void TarneldSession::fetchStatesWithUserInfo(MaybeDictionary userInfo, NamesReply completionHandler) {
  TARNEL_LOG(dependencies_.log, debug, "fetchStatesWithUserInfo: Fetching states for session %u",
             sessionID());
  receivedUserInfo(userInfo);
  completionHandler(fetchReportingStates());
}

void TarneldSession::fetchDisplayURL(TextReply reply) {
  TARNEL_LOG(dependencies_.log, debug, "fetchDisplayURL: Fetching display URL for session %u", sessionID());
  for (const char* name : {kTarnelBackendHTTPPost, kTarnelBackendHTTPPost2, kTarnelBackendDashboard}) {
    if (const std::string* url = displayURLOf(_backends, name)) {
      reply(*url);
      return;
    }
  }
  reply("URL not available");
}

void TarneldSession::finishSessionWithReply(SentReply reply) {
  TARNEL_LOG(dependencies_.log, debug, "finishSessionWithReply: Finishing session %u", sessionID());
  reply(sendMessageWithCategory(0, kFinishType, std::nullopt));
}

void TarneldSession::sendStartMessage() {
  const TimeValue now = dependencies_.clock.timeOfDay();
  const auto automatic = dependencies_.settings.objectForKey(kTimeSettingsDomain, kAutomaticTimeZoneKey);
  Dictionary payload;
  if (dependencies_.process.isInternalBuild()) {
    DeviceInformation& device = dependencies_.deviceInformation;
    payload.set("SerialNum", serialNumber(device).value_or("Unknown"));
    payload.set("Version", productVersion(device).value_or("Unknown"));
    payload.set("Build", buildVersion(device).value_or("Unknown"));
    payload.set("Hardware", hardwareModel(device).value_or("Unknown"));
    payload.set("Product", deviceName(device).value_or("Unknown"));
    payload.set("ReportVers", dependencies_.clientBundle.version().value_or("8.0"));
  }
  // A locale that names no country leaves the entry out: a missing object cannot stand in a dictionary.
  if (auto country = dependencies_.locale.countryCode()) payload.set("Locale", std::move(*country));
  payload.set("AutomaticTimeSet", automatic ? automatic->boolValue() : true);
  internalSendMessage(payload, now, kInternalMethod, kStart);
}

std::string TarneldSession::description() const {
  return "<TarneldSession " + _sessionIDString + ", session " + std::to_string(sessionID()) + ">";
}

TarneldSessionClassLock& TarneldSession::classLock() {
  static TarneldSessionClassLock lock;
  return lock;
}

}  // namespace tarnel
