#include <algorithm>

#include "backends/https/https_post_backend.h"
#include "tarnel/keys.h"
#include "util/identifiers.h"

// Which reporting state follows from the profile.

namespace tarnel {
namespace {

std::string listDescription(const ProfileSection& client, std::string_view key) {
  const auto* list = client.findArray(key);
  return list == nullptr ? "(null)" : description(*list);
}

std::optional<Value> copied(const Value* value) {
  return value == nullptr ? std::nullopt : std::optional<Value>(*value);
}

MaybeString copied(const std::string* text) {
  return text == nullptr ? std::nullopt : MaybeString(*text);
}

// A number as the log shows it.
double singlePrecision(const std::optional<Value>& number) {
  return number ? static_cast<double>(static_cast<float>(number->doubleValue())) : 0.0;
}

}  // namespace

MaybeString HTTPSPostBackend::userInfoText(const char* key) const {
  return userInfoDict() ? copied(findString(*userInfoDict(), key)) : std::nullopt;
}

bool HTTPSPostBackend::updatePostLink(const ProfileSection& client) {
  bool taken = false;
  if (!(_useDefaultPostURL && _postURL)) {
    _useDefaultPostURL = false;
    if (const auto* url = client.findString("post_url")) {
      _postURL = *url;
      taken = true;
      TARNEL_LOG(dependencies().log, debug, "HTTPSPostBackend(updatePostLink): Storebag '%s' for postURL",
                 url->c_str());
    }
  }
  updateRealtimePostLink(client);
  return taken;
}

void HTTPSPostBackend::updateRealtimePostLink(const ProfileSection& client) {
  if (_useDefaultRealtimePostURL && _realtimePostURL) return;
  _useDefaultRealtimePostURL = false;
  if (const auto* url = client.findString("realtime_post_url")) {
    _realtimePostURL = *url;
    TARNEL_LOG(dependencies().log, debug,
               "HTTPSPostBackend(updatePostLink): Storebag '%s' for realtimePostURL", url->c_str());
    return;
  }
  _realtimePostURL = _postURL;
  TARNEL_LOG(dependencies().log, debug,
             "HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL '%s'",
             printable(_realtimePostURL));
}

bool HTTPSPostBackend::matchClientNameAndServiceID(const ProfileSection& client,
                                                   const MaybeString& clientName,
                                                   const MaybeString& serviceID) {
  MaybeTextList clients;
  MaybeTextList services;
  return client.readNames("client", clients) && matchExactStringWithList(clients, clientName, true) &&
         client.readNames("service", services) && matchStringWithList(services, serviceID, true);
}

void HTTPSPostBackend::resetBackendStateWithClient(const ProfileSection* client) {
  _eventThreshold = client == nullptr ? 0 : client->integerOrZero("event_threshold");
  TARNEL_LOG(dependencies().log, debug, "resetBackendStateWithClient: event_threshold set to %d",
             _eventThreshold);
  _extrasOnInternal = client == nullptr ? 0 : client->integerOrZero("extras_on_internal");
  TARNEL_LOG(dependencies().log, debug, "setBackendStateWithClient: extras on internal is set to %d",
             _extrasOnInternal);
}

ReportingState HTTPSPostBackend::updateBackendState() {
  ProfileReader reader(dependencies().log, name(), "updateBackendState");
  const auto section = reader.section(*profile());
  const auto clients = section.findDictionaries("clients");
  const auto clientName = userInfoText(kTarnelUserInfoClientName);
  const auto serviceID = userInfoText(kTarnelUserInfoServiceName);
  const auto matching = std::find_if(clients.begin(), clients.end(), [&](const ProfileSection& client) {
    return matchClientNameAndServiceID(client, clientName, serviceID);
  });
  if (matching != clients.end()) overrideBatching(*matching);
  if (!requireUserInfo()) return stateWithoutUserInfo(clients);
  if (!userInfoDict()) return ReportingState::undecided;
  if (matching == clients.end()) return ReportingState::disabled;
  return stateForClient(*matching, clientName, serviceID);
}

void HTTPSPostBackend::overrideBatching(const ProfileSection& client) {
  const auto* expedite = client.findNumber("expedite");
  if (expedite == nullptr) return;
  setBatchEvents(expedite->boundedInt32Value() == 0);
  TARNEL_LOG(dependencies().log, debug,
             "HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=%d", batchEvents());
}

ReportingState HTTPSPostBackend::stateWithoutUserInfo(const std::vector<ProfileSection>& clients) {
  const auto taken = std::find_if(clients.begin(), clients.end(),
                                  [this](const ProfileSection& client) { return updatePostLink(client); });
  resetBackendStateWithClient(taken == clients.end() ? nullptr : &*taken);
  return ReportingState::enabled;
}

// A refusal leaves in place what was set before it: the level, say, at which the sessions below still find
// this one.
ReportingState HTTPSPostBackend::stateForClient(const ProfileSection& client, const MaybeString& clientName,
                                                const MaybeString& serviceID) {
  auto& log = dependencies().log;
  const auto country = dependencies().locale.countryCode();
  setHierarchy(client.integerOrZero("hierarchy"));
  if (!allowedByConsent(client)) return ReportingState::disabled;
  if (!allowedByPlaceAndDevice(client, country)) return ReportingState::disabled;
  if (client.findArray("filters") == nullptr) {
    TARNEL_LOG(log, warning, "HTTPSPostBackend(updateBackendState): filters are required.");
    return ReportingState::disabled;
  }
  _filters.createFiltersFromArray(client.findDictionaries("filters"));
  chooseSamplingThreshold(client, country);
  const auto state = stateBySampling(client);
  resetBackendStateWithClient(&client);
  if (client.findAny("custom_clientId") != nullptr) {
    _uuidCustom = getPersistentIdentifierForCustomClientIDSuffix(dependencies(), clientName, serviceID);
  }
  TARNEL_LOG(log, debug,
             "HTTPSPostBackend(updateBackendState): %s: client found %s:%s, state=%d, samplingFactor=%f, "
             "hierarchy=%d",
             name().c_str(), printable(clientName), printable(serviceID), static_cast<int>(state),
             samplingFactor(), hierarchy());
  updatePostLink(client);
  return state;
}

bool HTTPSPostBackend::allowedByConsent(const ProfileSection& client) {
  const int32_t overrideDnu = client.integerOrZero("override_dnu");
  if (overrideDnu == 1) {
    _dnuType = _dnuEnabled ? 2 : 1;
    return true;
  }
  _dnuType = 0;
  if (_dnuEnabled) return true;
  TARNEL_LOG(dependencies().log, debug,
             "HTTPSPostBackend(updateBackendState): reporting disabled by DNU: %d.", overrideDnu);
  return false;
}

bool HTTPSPostBackend::allowedByPlaceAndDevice(const ProfileSection& client,
                                               const MaybeString& country) const {
  auto& log = dependencies().log;
  // Matched like a blacklist: an entry has to name its countries, so without a list nobody reports. A device
  // that knows no country cannot be said to be outside of them, so it does.
  if (!matchStringWithList(client.findTexts("locale_whitelist"), country, false)) {
    TARNEL_LOG(log, debug, "HTTPSPostBackend(updateBackendState): (%s) isn't in country code list %s",
               printable(country), listDescription(client, "locale_whitelist").c_str());
    return false;
  }
  if (!matchStringWithList(client.findTexts("device_whitelist"), productFamily(), true)) {
    TARNEL_LOG(log, debug, "HTTPSPostBackend(updateBackendState): (%s) isn't in device whitelist %s",
               printable(productFamily()), listDescription(client, "device_whitelist").c_str());
    return false;
  }
  if (matchStringWithList(client.findTexts("device_blacklist"), hardwareType(), false)) {
    TARNEL_LOG(log, debug, "HTTPSPostBackend(updateBackendState): (%s) is in device blacklist %s",
               printable(hardwareType()), listDescription(client, "device_blacklist").c_str());
    return false;
  }
  return true;
}

void HTTPSPostBackend::chooseSamplingThreshold(const ProfileSection& client, const MaybeString& country) {
  setSamplingThreshold(copied(client.findNumber("sampling_threshold")));
  if (!country) return;
  for (const auto& item : client.findDictionaries("per_country_sampling_thresholds")) {
    const auto countries = item.findTexts("country");
    if (!countries || std::find(countries->begin(), countries->end(), *country) == countries->end()) continue;
    const auto threshold = copied(item.findNumber("threshold"));
    TARNEL_LOG(dependencies().log, debug,
               "HTTPSPostBackend(updateBackendState): sampling threshold for %s changed from %.02f to %.02f",
               country->c_str(), singlePrecision(samplingThreshold()), singlePrecision(threshold));
    setSamplingThreshold(threshold);
    return;
  }
}

ReportingState HTTPSPostBackend::stateBySampling(const ProfileSection& client) {
  if (!samplingThreshold()) return ReportingState::disabled;
  if (samplingFactor() <= samplingThreshold()->doubleValue()) return ReportingState::enabled;
  _overrideSampling = copied(client.findNumber("override_sampling"));
  if (!_overrideSampling || samplingFactor() <= _overrideSampling->doubleValue())
    return ReportingState::sampledOut;
  return ReportingState::disabled;
}

}  // namespace tarnel
