#pragma once

#include <memory>
#include <span>
#include <string>
#include <string_view>

#include "base/error.h"
#include "base/value.h"

struct evp_pkey_st;

namespace tarnel {

// The private key that signs storebags. Copies share the key; immutable.
// Threads: any. Errors carry kToolErrorDomain and name the remedy.
class StorebagKey {
 public:
  static constexpr int kDefaultBits = 3072;

  // bits: 2048 to 16384. Takes up to some seconds for the larger ones.
  static Result<StorebagKey> generate(int bits = kDefaultBits);
  // Unencrypted PEM (PKCS #8 or PKCS #1) of an RSA key.
  static Result<StorebagKey> fromPem(std::string_view pem);
  static Result<StorebagKey> load(const std::string& path);

  // PKCS #8 PEM, readable for its owner alone (mode 0600), replaced in one step.
  MaybeError save(const std::string& path) const;

  // SubjectPublicKeyInfo (RFC 5280): what belongs into the bundle's publicKey.der.
  Data publicKeyDer() const;
  // RSASSA-PKCS1-v1_5 with SHA-1 (RFC 8017 section 8.2.1) over exactly these bytes.
  Result<Data> sign(std::span<const uint8_t> bytes) const;

 private:
  explicit StorebagKey(std::shared_ptr<evp_pkey_st> key) : key_(std::move(key)) {}

  std::shared_ptr<evp_pkey_st> key_;
};

// Makes the folder a client bundle: publicKey.der of this key and the version text.
MaybeError writeClientBundle(const std::string& directory, const StorebagKey& key, std::string_view version);

}  // namespace tarnel
