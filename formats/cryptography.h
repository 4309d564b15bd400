#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "base/value.h"

// Digests, signatures and base-64. Threads: all functions may be called from any thread.

namespace tarnel {

using Sha1Digest = std::array<uint8_t, 20>;
using Sha256Digest = std::array<uint8_t, 32>;

Sha1Digest sha1(std::span<const uint8_t> bytes);
Sha256Digest sha256(std::span<const uint8_t> bytes);

// An RSA public key; immutable.
class RsaPublicKey {
 public:
  RsaPublicKey() = default;
  RsaPublicKey(const RsaPublicKey&) = delete;
  RsaPublicKey& operator=(const RsaPublicKey&) = delete;
  virtual ~RsaPublicKey() = default;

  // From DER (SubjectPublicKeyInfo, RFC 5280, or RSAPublicKey, RFC 8017 A.1.1). Null when the bytes are no
  // RSA key of 1024 to 16384 bits.
  static std::shared_ptr<const RsaPublicKey> fromDer(std::span<const uint8_t> der);

  // RSASSA-PKCS1-v1_5 over a SHA-1 digest (RFC 8017 section 8.2.2).
  virtual bool verifyPkcs1Sha1(const Sha1Digest& digest, std::span<const uint8_t> signature) const = 0;
};

// RFC 4648 section 4, with padding, no line breaks.
std::string base64Encode(std::span<const uint8_t> bytes);
// Characters outside the alphabet are ignored; padding ends the text. Nothing when what remains cannot be
// base-64 (a single left-over character, or padding that does not fit what stands before it). Empty text
// gives empty data.
std::optional<Data> base64Decode(std::string_view text);

}  // namespace tarnel
