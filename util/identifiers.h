#pragma once

#include <string>

#include "util/dependencies.h"

namespace tarnel {

// A random UUID text (36 characters) that stays the same for the same two parts, kept in the settings store
// under "uuid:FIRST:SECOND"; a missing part is the empty text. A store that cannot be read gives a new one
// every time, and so do names of more than about 500 bytes, which are not stored.
std::string getPersistentIdentifierForCustomClientIDSuffix(const Dependencies& dependencies,
                                                           const MaybeString& first,
                                                           const MaybeString& second);

// A random UUID text that holds for the life of the process.
const std::string& processLifetimeIdentifier(Random& random);

}  // namespace tarnel
