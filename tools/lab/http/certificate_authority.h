#pragma once

#include <ctime>
#include <optional>
#include <string>
#include <vector>

#include "base/error.h"

namespace tarnel::lab {

// Files of the lab's own certificate authority and of the certificate it serves with.
struct CertificateFiles {
  std::string authority;     // ca.pem
  std::string authorityKey;  // mode 0600
  std::string server;
  std::string serverKey;  // mode 0600
};

// What was made, for telling people.
struct CertificateWork {
  bool madeAuthority = false;
  std::optional<std::string> madeServerBecause;
};

// Makes what is missing, and the server certificate anew when it expires within 30 days, was signed by
// another authority, or does not name all of the names (numeric addresses or host names). A damaged or
// expiring authority is an error that names the fix: nobody should come to trust a new one unasked.
Result<CertificateWork> ensureCertificates(const CertificateFiles& files,
                                           const std::vector<std::string>& names, std::time_t now);

}  // namespace tarnel::lab
