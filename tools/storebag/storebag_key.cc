#include "tools/storebag/storebag_key.h"

#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <array>
#include <climits>

#include "formats/cryptography.h"
#include "tools/files/file_io.h"

namespace tarnel {
namespace {

constexpr size_t kMaxPemBytes = 64U << 10U;

template <auto Free>
struct OpenSslFree {
  template <class T>
  void operator()(T* object) const {
    Free(object);
  }
};
using BioPointer = std::unique_ptr<BIO, OpenSslFree<BIO_free_all>>;
using KeyContextPointer = std::unique_ptr<EVP_PKEY_CTX, OpenSslFree<EVP_PKEY_CTX_free>>;

Error keyError(std::string text) {
  char reason[256] = "";
  if (const unsigned long code = ERR_get_error(); code != 0) {
    ERR_error_string_n(code, reason, sizeof reason);
    text += std::string(" (") + reason + ")";
  }
  ERR_clear_error();
  return Error(kToolErrorDomain, -1, std::move(text));
}

// Never asks on the terminal for a passphrase.
int noPassphrase(char*, int, int, void*) {
  return -1;
}

// DER of DigestInfo {sha1, NULL} up to the digest (RFC 8017 section 9.2, note 1). The block is put together
// here, so that a system-wide policy against new SHA-1 signatures does not stop the tools.
constexpr std::array<uint8_t, 15> kSha1DigestInfo = {0x30, 0x21, 0x30, 0x09, 0x06, 0x05, 0x2b, 0x0e,
                                                     0x03, 0x02, 0x1a, 0x05, 0x00, 0x04, 0x14};

}  // namespace

Result<StorebagKey> StorebagKey::generate(int bits) {
  if (bits < 2048 || bits > 16384) {
    return Error(kToolErrorDomain, -1, "a storebag key has 2048 to 16384 bits, not " + std::to_string(bits));
  }
  std::shared_ptr<EVP_PKEY> key(EVP_RSA_gen(static_cast<unsigned int>(bits)), EVP_PKEY_free);
  if (!key) return keyError("cannot make an RSA key");
  return StorebagKey(std::move(key));
}

Result<StorebagKey> StorebagKey::fromPem(std::string_view pem) {
  if (pem.size() > kMaxPemBytes) return Error(kToolErrorDomain, -1, "not a key: too large for one");
  const BioPointer bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  std::shared_ptr<EVP_PKEY> key(
      bio ? PEM_read_bio_PrivateKey(bio.get(), nullptr, noPassphrase, nullptr) : nullptr, EVP_PKEY_free);
  if (!key) return keyError("not an unencrypted private key in PEM form");
  if (EVP_PKEY_get_base_id(key.get()) != EVP_PKEY_RSA) {
    return Error(kToolErrorDomain, -1, "not an RSA key: storebags are signed with RSA");
  }
  if (EVP_PKEY_get_bits(key.get()) < 1024) {
    return Error(kToolErrorDomain, -1, "an RSA key of less than 1024 bits cannot sign storebags");
  }
  return StorebagKey(std::move(key));
}

Result<StorebagKey> StorebagKey::load(const std::string& path) {
  const Result<std::string> pem = readFile(path, kMaxPemBytes);
  if (!pem) return pem.error();
  Result<StorebagKey> key = fromPem(*pem);
  if (key) return key;
  return Error(
      kToolErrorDomain, -1,
      path + ": " + key.error().localizedDescription() +
          "; give a storebag-key.pem that tarnelctl storebag keygen or tarnel-lab made (remove the file, and "
          "the lab makes a new one; the daemon then needs the new publicKey.der)");
}

MaybeError StorebagKey::save(const std::string& path) const {
  const BioPointer bio(BIO_new(BIO_s_mem()));
  if (!bio ||
      PEM_write_bio_PKCS8PrivateKey(bio.get(), key_.get(), nullptr, nullptr, 0, nullptr, nullptr) != 1) {
    return keyError("cannot write the key as PEM");
  }
  char* text = nullptr;
  const long size = BIO_get_mem_data(bio.get(), &text);
  return writeFile(path, std::string_view(text, static_cast<size_t>(size)), 0600);
}

Data StorebagKey::publicKeyDer() const {
  unsigned char* bytes = nullptr;
  const int size = i2d_PUBKEY(key_.get(), &bytes);
  if (size <= 0) return {};
  Data der(bytes, bytes + size);
  OPENSSL_free(bytes);
  return der;
}

Result<Data> StorebagKey::sign(std::span<const uint8_t> bytes) const {
  const Sha1Digest digest = sha1(bytes);
  std::array<uint8_t, kSha1DigestInfo.size() + std::tuple_size_v<Sha1Digest>> block{};
  std::copy(digest.begin(), digest.end(),
            std::copy(kSha1DigestInfo.begin(), kSha1DigestInfo.end(), block.begin()));
  const KeyContextPointer context(EVP_PKEY_CTX_new_from_pkey(nullptr, key_.get(), nullptr));
  size_t size = 0;
  if (!context || EVP_PKEY_sign_init(context.get()) != 1 ||
      EVP_PKEY_CTX_set_rsa_padding(context.get(), RSA_PKCS1_PADDING) != 1 ||
      EVP_PKEY_sign(context.get(), nullptr, &size, block.data(), block.size()) != 1) {
    return keyError("cannot sign");
  }
  Data signature(size);
  if (EVP_PKEY_sign(context.get(), signature.data(), &size, block.data(), block.size()) != 1) {
    return keyError("cannot sign");
  }
  signature.resize(size);
  return signature;
}

MaybeError writeClientBundle(const std::string& directory, const StorebagKey& key, std::string_view version) {
  if (MaybeError error = makeDirectory(directory, 0755)) return error;
  const Data der = key.publicKeyDer();
  const std::string_view bytes(reinterpret_cast<const char*>(der.data()), der.size());
  if (MaybeError error = writeFile(directory + "/publicKey.der", bytes, 0644)) return error;
  return writeFile(directory + "/version", std::string(version) + "\n", 0644);
}

}  // namespace tarnel
