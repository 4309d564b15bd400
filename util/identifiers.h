#pragma once

#include <cstddef>
#include <string>

#include "util/dependencies.h"

namespace tarnel {

// What the stored identifiers may take of the settings, all together, as the settings file would spell them
// at most. Their names come from clients; the file is read and written whole with each new one, and other
// settings need their place in it.
inline constexpr size_t kMaxStoredIdentifierBytes = size_t{256} << 10U;

// A random UUID text (36 characters) that stays the same for the same two parts, kept in the settings store
// under "uuid:FIRST:SECOND"; a missing part is the empty text. Whatever text is stored there is returned,
// also an empty one. A store that cannot be read gives a new one every time.
//
// One that would exceed kMaxStoredIdentifierBytes is not stored: it stays the same for the life of the
// process, with a warning at each call. What is stored is never dropped for it.
std::string getPersistentIdentifierForCustomClientIDSuffix(const Dependencies& dependencies,
                                                           const MaybeString& first,
                                                           const MaybeString& second);

}  // namespace tarnel
