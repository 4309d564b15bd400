#include "util/identifiers.h"

#include <algorithm>
#include <string_view>

#include "util/process_values.h"

namespace tarnel {
namespace {

constexpr char kKeyPrefix[] = "uuid:";
// Identifier, quotes, equals sign and line end, with room to spare.
constexpr size_t kBytesBesidesTheKey = 64;
constexpr size_t kBytesOfAnEscape = 6;

// Nothing when the store has no text under the key.
MaybeString storedIdentifier(const Dependencies& dependencies, const std::string& key) {
  const auto value = dependencies.settings.objectForKey(kTarnelSettingsDomain, key);
  if (!value) return std::nullopt;
  const auto* text = value->string();
  if (text == nullptr) {
    TARNEL_LOG(dependencies.log, warning,
               "getPersistentIdentifierForCustomClientIDSuffix: ignoring the setting '%s' of %s: expected a "
               "text; remove it",
               key.c_str(), kTarnelSettingsDomain);
    return std::nullopt;
  }
  return *text;
}

bool isEscaped(char character) {
  const auto code = static_cast<unsigned char>(character);
  return code < 0x20 || code == 0x7F || character == '"' || character == '\\';
}

// The most that an identifier takes in the settings file.
size_t storedBytes(std::string_view key) {
  const auto escapes = static_cast<size_t>(std::count_if(key.begin(), key.end(), isEscaped));
  return kBytesBesidesTheKey + key.size() + escapes * (kBytesOfAnEscape - 1);
}

bool hasRoomFor(const Dependencies& dependencies, const std::string& key) {
  size_t bytes = storedBytes(key);
  for (const auto& other : dependencies.settings.ownKeys(kTarnelSettingsDomain, kKeyPrefix)) {
    if (other != key) bytes += storedBytes(other);
  }
  return bytes <= kMaxStoredIdentifierBytes;
}

std::string storedOrNewIdentifier(const Dependencies& dependencies, const std::string& key) {
  if (auto stored = storedIdentifier(dependencies, key)) return *std::move(stored);
  const auto lock = dependencies.process.lockIdentifierCreation();
  if (auto stored = storedIdentifier(dependencies, key)) return *std::move(stored);
  if (!hasRoomFor(dependencies, key)) {
    TARNEL_LOG(
        dependencies.log, warning,
        "getPersistentIdentifierForCustomClientIDSuffix: the identifiers stored for clients would take "
        "more than %zu bytes; this one lasts until the daemon ends. Remove some that nobody needs, "
        "with: tarnelctl settings unset %s KEY",
        kMaxStoredIdentifierBytes, kTarnelSettingsDomain);
    return dependencies.process.processLifetimeIdentifier(key);
  }
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
  const std::string key = kKeyPrefix + first.value_or("") + ":" + second.value_or("");
  std::string identifier = storedOrNewIdentifier(dependencies, key);
  TARNEL_LOG(dependencies.log, information,
             "getPersistentIdentifierForCustomClientIDSuffix: The value for %s: %s", key.c_str(),
             identifier.c_str());
  return identifier;
}

}  // namespace tarnel
