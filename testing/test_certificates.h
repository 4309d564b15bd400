#pragma once

#include <openssl/x509.h>

#include <chrono>
#include <memory>
#include <string>

namespace tarnel::test {

struct FreeOpenSsl {
  void operator()(X509* certificate) const { X509_free(certificate); }
  void operator()(EVP_PKEY* key) const { EVP_PKEY_free(key); }
};

// What a TLS server shows: its certificate and key.
struct TlsIdentity {
  std::string certificatePem;
  std::string keyPem;
};

// When a certificate holds, counted from now.
struct Validity {
  std::chrono::seconds from = -std::chrono::hours(1);
  std::chrono::seconds until = std::chrono::hours(24);
};

// A certificate authority that lives as long as the test.
class TestAuthority {
 public:
  explicit TestAuthority(const std::string& name);

  const std::string& certificatePem() const { return certificatePem_; }
  // For an OpenSSL subjectAltName, by default this machine's loopback names.
  TlsIdentity issue(const std::string& names = "DNS:localhost,IP:127.0.0.1", Validity validity = {}) const;

 private:
  std::unique_ptr<EVP_PKEY, FreeOpenSsl> key_;
  std::unique_ptr<X509, FreeOpenSsl> certificate_;
  std::string certificatePem_;
};

}  // namespace tarnel::test
