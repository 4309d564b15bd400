#include "client/shared/consent_identifiers.h"

#include <utility>

namespace tarnel {

namespace {

constexpr char kDomain[] = "com.orvane.tarnel";
constexpr char kRespectKey[] = "dnu:respect";
constexpr char kOverrideKey[] = "dnu:override";

}  // namespace

ConsentIdentifiers::ConsentIdentifiers(SettingsStore& settings, Consent& consent, Random& random)
    : settings_(settings), consent_(consent), random_(random) {}

MaybeString ConsentIdentifiers::getPersistentIdentifierForDNU(int respect) {
  const std::lock_guard guard(mutex_);
  if (respect == 0) return storedOrNew(kOverrideKey);
  const bool allowed = consent_.isDiagnosticSubmissionAllowed();
  if (!allowed || mustBeDropped_) dropRespecting();
  if (!allowed) return std::nullopt;
  // What could not be forgotten must not come back: such an identifier holds for this call alone.
  return mustBeDropped_ ? uuidText(random_.uuid()) : storedOrNew(kRespectKey);
}

void ConsentIdentifiers::dropRespecting() {
  mustBeDropped_ = settings_.removeObject(kDomain, kRespectKey).has_value();
}

std::string ConsentIdentifiers::storedOrNew(const char* key) {
  if (const auto stored = settings_.objectForKey(kDomain, key)) {
    const std::string* text = stored->string();
    if (text != nullptr && !text->empty()) return *text;
  }
  std::string identifier = uuidText(random_.uuid());
  // Without a store it is as good as any, and the store has told its trouble.
  static_cast<void>(settings_.setObject(kDomain, key, Value(identifier)));
  return identifier;
}

}  // namespace tarnel
