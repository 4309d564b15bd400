#pragma once

#include <mutex>
#include <string>

#include "base/value.h"
#include "platform/consent.h"
#include "platform/random.h"
#include "platform/settings_store.h"

namespace tarnel {

// Gives the two stable identifiers under which a device reports. Threads: any.
class ConsentIdentifierProvider {
 public:
  ConsentIdentifierProvider() = default;
  ConsentIdentifierProvider(const ConsentIdentifierProvider&) = delete;
  ConsentIdentifierProvider& operator=(const ConsentIdentifierProvider&) = delete;
  virtual ~ConsentIdentifierProvider() = default;

  // getPersistentIdentifierForDNU:
  // respect: 1 for the identifier that honours consent, 0 for the one that overrides it.
  // Nothing when the provider fails; messages then go out without identifier and without events.
  virtual MaybeString getPersistentIdentifierForDNU(int respect) = 0;
};

// The provider that draws them (36-character UUID texts) and keeps them in the settings store. It never
// fails.
//
// The overriding identifier is drawn once and stays.
//
// The one that honours consent holds as long as the user does not change his mind. It is drawn anew when
// consent is withdrawn, so that nothing of before can be joined with anything after, and drawn anew once more
// when it is given: what was reported under neither decision belongs to the other. While consent is withheld
// there is one as well, for the events that are about no user.
//
// For that each decision has a key of its own, and asking under one decision forgets what the other had. An
// asker that runs all the time sees every change; whoever writes a decision calls consentChanged(), because
// nobody may ask between two changes. A file that is changed by hand and back between two questions is not
// noticed.
//
// What cannot be stored holds for the life of this object. What the store refuses to forget this object
// does not use again.
class ConsentIdentifiers final : public ConsentIdentifierProvider {
 public:
  // All three are kept by reference and must outlive this object.
  ConsentIdentifiers(SettingsStore& settings, Consent& consent, Random& random);

  // Always a text.
  MaybeString getPersistentIdentifierForDNU(int respect) override;

  // Forgets the identifier of the decision that no longer holds. The store's error when it refuses.
  MaybeError consentChanged();

 private:
  struct Kept {
    const char* key;
    bool isForgotten = false;  // nothing is stored under the key
    bool isStale = false;      // what is stored under it must not be used
    MaybeString unstored;      // what is used as long as it cannot be stored
  };

  std::string valueOf(Kept& kept);
  MaybeError forget(Kept& kept);
  Kept& keptFor(bool allowed) { return allowed ? agreed_ : withheld_; }

  SettingsStore& settings_;
  Consent& consent_;
  Random& random_;
  std::mutex mutex_;  // two first questions must get one answer; guards what follows
  Kept overriding_;
  Kept agreed_;
  Kept withheld_;
};

}  // namespace tarnel
