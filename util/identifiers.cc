#include "util/identifiers.h"

#include <mutex>

#include "util/process_values.h"

namespace tarnel {
namespace {

// Names come from clients. Longer keys are not stored, so that none of them fills the settings alone.
constexpr size_t kMaxKeyBytes = 512;

// Held while an identifier is made, so that two sessions asking at once get the same one.
constinit std::mutex creationMutex;

// Nothing when the store has no text under the key.
MaybeString storedIdentifier(const Dependencies& dependencies, const std::string& key) {
  const auto value = dependencies.settings.objectForKey(kTarnelSettingsDomain, key);
  if (!value) return std::nullopt;
  const auto* text = value->string();
  if (text == nullptr || text->empty()) {
    TARNEL_LOG(dependencies.log, warning,
               "getPersistentIdentifierForCustomClientIDSuffix: ignoring the setting '%s' of %s: expected a "
               "text; remove it",
               key.c_str(), kTarnelSettingsDomain);
    return std::nullopt;
  }
  return *text;
}

std::string storedOrNewIdentifier(const Dependencies& dependencies, const std::string& key) {
  if (key.size() > kMaxKeyBytes) {
    TARNEL_LOG(dependencies.log, warning,
               "getPersistentIdentifierForCustomClientIDSuffix: a key of %zu bytes is not stored; names may "
               "have %zu bytes together",
               key.size(), kMaxKeyBytes);
    return uuidText(dependencies.random.uuid());
  }
  if (auto stored = storedIdentifier(dependencies, key)) return *std::move(stored);
  const std::lock_guard lock(creationMutex);
  if (auto stored = storedIdentifier(dependencies, key)) return *std::move(stored);
  std::string identifier = uuidText(dependencies.random.uuid());
  if (const auto error = dependencies.settings.setObject(kTarnelSettingsDomain, key, identifier)) {
    TARNEL_LOG(dependencies.log, warning,
               "getPersistentIdentifierForCustomClientIDSuffix: the value for %s could not be stored: %s",
               key.c_str(), error->description().c_str());
  }
  return identifier;
}

}  // namespace

std::string getPersistentIdentifierForCustomClientIDSuffix(const Dependencies& dependencies,
                                                           const MaybeString& first,
                                                           const MaybeString& second) {
  const std::string key = "uuid:" + first.value_or("") + ":" + second.value_or("");
  std::string identifier = storedOrNewIdentifier(dependencies, key);
  TARNEL_LOG(dependencies.log, information,
             "getPersistentIdentifierForCustomClientIDSuffix: The value for %s: %s", key.c_str(),
             identifier.c_str());
  return identifier;
}

const std::string& processLifetimeIdentifier(Random& random) {
  static const std::string identifier = uuidText(random.uuid());
  return identifier;
}

}  // namespace tarnel
