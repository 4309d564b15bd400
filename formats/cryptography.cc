#include "formats/cryptography.h"

#include <openssl/evp.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <cstdio>
#include <cstdlib>

namespace tarnel {
namespace {

struct Free {
  void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
  void operator()(EVP_PKEY_CTX* context) const { EVP_PKEY_CTX_free(context); }
  void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
};
template <class T>
using Owned = std::unique_ptr<T, Free>;

// Kept to the end of the process: threads may still hash while statics are being destroyed.
const EVP_MD* fetched(const char* name) {
  const EVP_MD* digest = EVP_MD_fetch(nullptr, name, nullptr);
  if (digest == nullptr) {
    std::fprintf(stderr, "<2>OpenSSL offers no %s; enable its default provider in openssl.cnf\n", name);
    std::abort();
  }
  return digest;
}

const EVP_MD* sha1Digest() {
  static const EVP_MD* const digest = fetched("SHA1");
  return digest;
}

const EVP_MD* sha256Digest() {
  static const EVP_MD* const digest = fetched("SHA256");
  return digest;
}

// Setting a context up costs more than hashing a short text; each thread keeps one.
template <class Digest>
Digest digestOf(const EVP_MD* algorithm, EVP_MD_CTX* context, std::span<const uint8_t> bytes) {
  Digest digest{};
  if (EVP_DigestInit_ex2(context, algorithm, nullptr) != 1 ||
      EVP_DigestUpdate(context, bytes.data(), bytes.size()) != 1 ||
      EVP_DigestFinal_ex(context, digest.data(), nullptr) != 1) {
    std::fputs("<2>OpenSSL cannot compute a digest: out of memory\n", stderr);
    std::abort();
  }
  return digest;
}

class OpenSslRsaPublicKey final : public RsaPublicKey {
 public:
  explicit OpenSslRsaPublicKey(Owned<EVP_PKEY> key) : key_(std::move(key)) {}

  bool verifyPkcs1Sha1(const Sha1Digest& digest, std::span<const uint8_t> signature) const override {
    const Owned<EVP_PKEY_CTX> context(EVP_PKEY_CTX_new_from_pkey(nullptr, key_.get(), nullptr));
    return context != nullptr && EVP_PKEY_verify_init(context.get()) == 1 &&
           EVP_PKEY_CTX_set_rsa_padding(context.get(), RSA_PKCS1_PADDING) == 1 &&
           EVP_PKEY_CTX_set_signature_md(context.get(), sha1Digest()) == 1 &&
           EVP_PKEY_verify(context.get(), signature.data(), signature.size(), digest.data(), digest.size()) ==
               1;
  }

 private:
  Owned<EVP_PKEY> key_;
};

// A key that takes up all the bytes; both forms are tried.
Owned<EVP_PKEY> keyFrom(std::span<const uint8_t> der) {
  const auto length = static_cast<long>(der.size());
  const uint8_t* const end = der.data() + der.size();
  const uint8_t* position = der.data();
  Owned<EVP_PKEY> key(d2i_PUBKEY(nullptr, &position, length));
  if (key == nullptr) {
    position = der.data();
    key.reset(d2i_PublicKey(EVP_PKEY_RSA, nullptr, &position, length));
  }
  return key != nullptr && position == end ? std::move(key) : nullptr;
}

}  // namespace

Sha1Digest sha1(std::span<const uint8_t> bytes) {
  thread_local const Owned<EVP_MD_CTX> context(EVP_MD_CTX_new());
  return digestOf<Sha1Digest>(sha1Digest(), context.get(), bytes);
}

Sha256Digest sha256(std::span<const uint8_t> bytes) {
  thread_local const Owned<EVP_MD_CTX> context(EVP_MD_CTX_new());
  return digestOf<Sha256Digest>(sha256Digest(), context.get(), bytes);
}

std::shared_ptr<const RsaPublicKey> RsaPublicKey::fromDer(std::span<const uint8_t> der) {
  constexpr size_t kLargestKey = 16384;  // bytes; a key of 16384 bits needs an eighth of it
  constexpr int kFewestBits = 1024;
  constexpr int kMostBits = 16384;
  if (der.empty() || der.size() > kLargestKey) return nullptr;
  Owned<EVP_PKEY> key = keyFrom(der);
  if (key == nullptr || EVP_PKEY_get_base_id(key.get()) != EVP_PKEY_RSA) return nullptr;
  const int bits = EVP_PKEY_get_bits(key.get());
  if (bits < kFewestBits || bits > kMostBits) return nullptr;
  return std::make_shared<OpenSslRsaPublicKey>(std::move(key));
}

}  // namespace tarnel
