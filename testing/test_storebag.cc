#include "testing/test_storebag.h"

#include <openssl/evp.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <memory>
#include <span>
#include <stdexcept>

#include "formats/cryptography.h"
#include "formats/document.h"

namespace tarnel::fake {
namespace {

struct KeyDeleter {
  void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
};
struct ContextDeleter {
  void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
};
using Key = std::unique_ptr<EVP_PKEY, KeyDeleter>;

void require(bool holds, const char* what) {
  if (!holds) throw std::runtime_error(what);
}

std::span<const uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

}  // namespace

StorebagSigner::StorebagSigner() {
  const Key key(EVP_RSA_gen(2048));
  require(key != nullptr, "no RSA key");
  privateKeyDer_.resize(static_cast<size_t>(i2d_PrivateKey(key.get(), nullptr)));
  auto* out = privateKeyDer_.data();
  i2d_PrivateKey(key.get(), &out);
  publicKeyDer_.resize(static_cast<size_t>(i2d_PUBKEY(key.get(), nullptr)));
  out = publicKeyDer_.data();
  i2d_PUBKEY(key.get(), &out);
}

const StorebagSigner& StorebagSigner::shared() {
  static const StorebagSigner signer;
  return signer;
}

const StorebagSigner& StorebagSigner::foreign() {
  static const StorebagSigner signer;
  return signer;
}

Data StorebagSigner::sign(std::string_view bytes) const {
  const auto* in = privateKeyDer_.data();
  const Key key(d2i_AutoPrivateKey(nullptr, &in, static_cast<long>(privateKeyDer_.size())));
  const std::unique_ptr<EVP_MD_CTX, ContextDeleter> context(EVP_MD_CTX_new());
  require(EVP_DigestSignInit(context.get(), nullptr, EVP_sha1(), nullptr, key.get()) == 1, "no signer");
  const auto input = bytesOf(bytes);
  size_t length = 0;
  require(EVP_DigestSign(context.get(), nullptr, &length, input.data(), input.size()) == 1, "no length");
  Data signature(length);
  require(EVP_DigestSign(context.get(), signature.data(), &length, input.data(), input.size()) == 1,
          "no signature");
  signature.resize(length);
  return signature;
}

std::string StorebagSigner::signedBag(std::string_view bag, DocumentForm form) const {
  return writeDocument(
      Dictionary{{"signature", base64Encode(sign(bag))}, {"bag", base64Encode(bytesOf(bag))}}, form);
}

std::string StorebagSigner::signedStorebag(const Dictionary& inner, DocumentForm form) const {
  return signedBag(writeDocument(inner, form), form);
}

std::string writeDocument(const Value& value, DocumentForm form) {
  return form == DocumentForm::text ? writeTextDocument(value) : writeBinaryDocument(value);
}

}  // namespace tarnel::fake
