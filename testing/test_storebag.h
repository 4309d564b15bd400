#pragma once

#include <string>
#include <string_view>

#include "base/value.h"

// For tests: a storebag server's side of the signature.

namespace tarnel::fake {

enum class DocumentForm { text, binary };

// An RSA key pair made for this process on first use. Threads: any.
class StorebagSigner {
 public:
  // The same object on every call.
  static const StorebagSigner& shared();
  // Another key than the shared one.
  static const StorebagSigner& foreign();

  // SubjectPublicKeyInfo in DER, as the client library's "publicKey.der" holds it.
  const Data& publicKeyDer() const { return publicKeyDer_; }
  // RSASSA-PKCS1-v1_5 with SHA-1.
  Data sign(std::string_view bytes) const;

  // The outer document for the inner one, both in the form given.
  std::string signedStorebag(const Dictionary& inner, DocumentForm form = DocumentForm::text) const;
  // The same for any inner bytes.
  std::string signedBag(std::string_view bag, DocumentForm form = DocumentForm::text) const;

 private:
  StorebagSigner();

  Data privateKeyDer_;
  Data publicKeyDer_;
};

// A document of its own in the form given.
std::string writeDocument(const Value& value, DocumentForm form);

}  // namespace tarnel::fake
