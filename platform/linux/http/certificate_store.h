#pragma once

#include <openssl/x509.h>

#include <memory>
#include <string>
#include <vector>

namespace tarnel::detail {

struct FreeStore {
  void operator()(X509_STORE* store) const { X509_STORE_free(store); }
};

// Whom TLS trusts, read once. A certificate that is no authority is trusted for itself.
struct CertificateStore {
  std::unique_ptr<X509_STORE, FreeStore> store;
  std::vector<std::string> problems;  // each names the file and the remedy
};

// The first of systemFiles that exists, all of extraFiles, and extraPem.
CertificateStore loadCertificates(const std::vector<std::string>& systemFiles,
                                  const std::vector<std::string>& extraFiles,
                                  const std::vector<std::string>& extraPem);

}  // namespace tarnel::detail
