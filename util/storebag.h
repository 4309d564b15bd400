#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "base/value.h"
#include "formats/cryptography.h"
#include "util/dependencies.h"

// Fetching the storebag, the signed configuration document of a client type.

namespace tarnel {

// Longest time in seconds for which a storebag stays valid, and the time where its server states none.
inline constexpr int32_t kStorebagMaxAgeSeconds = 86400;

// What a fetch reports beside its result. Each is left as it was unless the fetch says otherwise.
struct StorebagFetchSlots {
  int32_t& maxAge;            // seconds
  MaybeString& version;       // set on success
  bool& notModified;          // only ever set to true
  MaybeString* lastModified;  // in and out; null: no slot, no conditional request
};

// One synchronous fetch (up to 15 seconds) of the section for the device's environment; nothing on failure
// and when the server's document has not changed.
// Throws InvalidArgument when a verified document has no version.
std::optional<Dictionary> fetchStorebagForEnvironmentAndClientType(const Dependencies& dependencies,
                                                                   int32_t clientType,
                                                                   StorebagFetchSlots slots);

// Nothing for client types without a name (0 to 4, negative, above 17).
MaybeString storebagNameForClientType(int32_t clientType);

// Base address to which "/NAME?version=VERSION" is appended.
std::string storebagServerURL(const Dependencies& dependencies);

// RSASSA-PKCS1-v1_5 with SHA-1 over exactly these bytes (RFC 8017 section 8.2.2).
bool verifyStorebagSignature(const RsaPublicKey& key, std::span<const uint8_t> bag,
                             std::span<const uint8_t> signature);

}  // namespace tarnel
