#include "util/consent_identifiers.h"

namespace tarnel {

namespace {

constexpr char kDomain[] = "com.orvane.tarnel";

}  // namespace

ConsentIdentifiers::ConsentIdentifiers(SettingsStore& settings, Consent& consent, Random& random)
    : settings_(settings),
      consent_(consent),
      random_(random),
      overriding_{.key = "dnu:override"},
      agreed_{.key = "dnu:respect"},
      withheld_{.key = "dnu:withheld"} {}

MaybeString ConsentIdentifiers::getPersistentIdentifierForDNU(int respect) {
  const std::lock_guard guard(mutex_);
  if (respect == 0) return valueOf(overriding_);
  const bool allowed = consent_.isDiagnosticSubmissionAllowed();
  // A store that refuses is asked again with the next question; until then what it holds is stale.
  static_cast<void>(forget(keptFor(!allowed)));
  return valueOf(keptFor(allowed));
}

MaybeError ConsentIdentifiers::consentChanged() {
  const std::lock_guard guard(mutex_);
  return forget(keptFor(!consent_.isDiagnosticSubmissionAllowed()));
}

std::string ConsentIdentifiers::valueOf(Kept& kept) {
  const auto stored = kept.isStale ? std::nullopt : settings_.objectForKey(kDomain, kept.key);
  if (stored && stored->string() != nullptr) {
    kept.isForgotten = false;
    return *stored->string();
  }
  if (!kept.unstored) kept.unstored = uuidText(random_.uuid());
  std::string identifier = *kept.unstored;
  // Even a failed attempt may leave something behind.
  kept.isForgotten = false;
  if (!settings_.setObject(kDomain, kept.key, Value(identifier))) {
    kept.isStale = false;
    kept.unstored.reset();
  }
  return identifier;
}

MaybeError ConsentIdentifiers::forget(Kept& kept) {
  kept.unstored.reset();
  if (kept.isForgotten) return std::nullopt;
  auto error = settings_.removeObject(kDomain, kept.key);
  kept.isForgotten = !error;
  kept.isStale = error.has_value();
  return error;
}

}  // namespace tarnel
