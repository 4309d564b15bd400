#include "backends/https/https_post_backend.h"

namespace tarnel {

std::shared_ptr<HTTPSPostBackend> HTTPSPostBackend::initWithName(const Dependencies& dependencies,
                                                                 const std::string& name,
                                                                 const MaybeDictionary& profile,
                                                                 const MaybeString& productFamily) {
  if (!profile || !productFamily) return nullptr;
  ProfileReader reader(dependencies.log, name, "initWithName");
  const auto section = reader.section(*profile);
  if (section.findArray("clients") == nullptr) {
    TARNEL_LOG(dependencies.log, error, "HTTPSPostBackend(initWithName): can't find the client list.");
    return nullptr;
  }
  auto backend = std::make_shared<HTTPSPostBackend>(Private{}, dependencies, name, profile, productFamily);
  if (const auto* displayURL = section.findString("display_url")) backend->setDisplayURL(*displayURL);
  return backend;
}

HTTPSPostBackend::HTTPSPostBackend(Private, const Dependencies& dependencies, const std::string& name,
                                   const MaybeDictionary& profile, const MaybeString& productFamily)
    : TarnelBackend(dependencies, name, profile, productFamily) {
  _postURL = stringFromDefaults("httpsPostURL");
  if (_postURL) {
    TARNEL_LOG(dependencies.log, debug, "HTTPSPostBackend(initWithName): Using user default '%s' for postURL",
               _postURL->c_str());
  }
  _useDefaultPostURL = _postURL.has_value();
  _realtimePostURL = stringFromDefaults("httpsRealtimePostURL");
  if (_realtimePostURL) {
    TARNEL_LOG(dependencies.log, debug,
               "HTTPSPostBackend(initWithName): Using user default '%s' for realtimePostURL",
               _realtimePostURL->c_str());
  }
  _useDefaultRealtimePostURL = _realtimePostURL.has_value();
  _dnuEnabled = dependencies.consent.isDiagnosticSubmissionAllowed();
  _uuidRespectDnu = dependencies.consentIdentifiers.getPersistentIdentifierForDNU(1);
  _uuidOverrideDnu = dependencies.consentIdentifiers.getPersistentIdentifierForDNU(0);
  const auto force = dependencies.settings.objectForKey(kTarnelSettingsDomain, "forceEventLogging");
  _forceEventLogging = force && force->boolValue();
}

// A number reads as its text; what is neither text nor number counts as absent.
MaybeString HTTPSPostBackend::stringFromDefaults(const char* key) const {
  const auto value = dependencies().settings.objectForKey(kTarnelSettingsDomain, key);
  if (!value) return std::nullopt;
  if (const auto* text = value->string()) return *text;
  return value->isNumber() ? MaybeString(value->description()) : std::nullopt;
}

}  // namespace tarnel
