#pragma once

#include <mutex>

#include "platform/base/value.h"
#include "platform/consent.h"
#include "platform/random.h"
#include "platform/settings_store.h"

namespace tarnel {

// The two stable identifiers under which a device reports (36-character UUID texts), kept in the settings
// store. The one that honours consent exists only while the user agrees to diagnostics: it is dropped when
// asked for while consent is withheld, and made anew afterwards. The overriding one is made once and stays.
//
// Threads: any.
class ConsentIdentifiers {
 public:
  // All three are kept by reference and must outlive this object.
  ConsentIdentifiers(SettingsStore& settings, Consent& consent, Random& random);

  // getPersistentIdentifierForDNU:
  // respect: 1 for the identifier that honours consent (nothing while consent is withheld),
  // 0 for the one that overrides it. A store that cannot be read gives a new one every time.
  MaybeString getPersistentIdentifierForDNU(int respect);

 private:
  std::string storedOrNew(const char* key);
  void dropRespecting();

  SettingsStore& settings_;
  Consent& consent_;
  Random& random_;
  std::mutex mutex_;            // two first questions must get one answer
  bool mustBeDropped_ = false;  // guarded by mutex_; the store refused to forget
};

}  // namespace tarnel
