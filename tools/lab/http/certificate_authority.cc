#include "tools/lab/http/certificate_authority.h"

#include <arpa/inet.h>
#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <memory>

#include "tools/files/file_io.h"

namespace tarnel::lab {
namespace {

constexpr size_t kMaxFileBytes = 64U << 10U;
constexpr std::time_t kDay = 86'400;
constexpr std::time_t kAuthorityLife = 3650 * kDay;
constexpr std::time_t kServerLife = 397 * kDay;
constexpr std::time_t kRenewBefore = 30 * kDay;

template <auto Free>
struct Freed {
  template <class T>
  void operator()(T* object) const {
    Free(object);
  }
};
using Bio = std::unique_ptr<BIO, Freed<BIO_free_all>>;
using Key = std::unique_ptr<EVP_PKEY, Freed<EVP_PKEY_free>>;
using Certificate = std::unique_ptr<X509, Freed<X509_free>>;
using Number = std::unique_ptr<BIGNUM, Freed<BN_free>>;
using Extension = std::unique_ptr<X509_EXTENSION, Freed<X509_EXTENSION_free>>;

struct Identity {
  Key key;
  Certificate certificate;
};

Error failure(std::string text) {
  if (const char* reason = ERR_reason_error_string(ERR_peek_error()); reason != nullptr) {
    text += std::string(" (") + reason + ")";
  }
  ERR_clear_error();
  return Error(kToolErrorDomain, -1, std::move(text));
}

int noPassphrase(char*, int, int, void*) {
  return -1;
}

bool isNumeric(const std::string& name) {
  in_addr v4{};
  in6_addr v6{};
  return ::inet_pton(AF_INET, name.c_str(), &v4) == 1 || ::inet_pton(AF_INET6, name.c_str(), &v6) == 1;
}

bool addExtension(X509* certificate, X509* issuer, int nid, const std::string& value) {
  X509V3_CTX context;
  X509V3_set_ctx(&context, issuer, certificate, nullptr, nullptr, 0);
  const Extension extension(X509V3_EXT_conf_nid(nullptr, &context, nid, value.c_str()));
  return extension && X509_add_ext(certificate, extension.get(), -1) == 1;
}

bool setSerial(X509* certificate) {
  const Number number(BN_new());
  return number && BN_rand(number.get(), 127, BN_RAND_TOP_ANY, BN_RAND_BOTTOM_ANY) == 1 &&
         BN_to_ASN1_INTEGER(number.get(), X509_get_serialNumber(certificate)) != nullptr;
}

// Everything but issuer, extensions and signature.
Identity unsignedIdentity(const std::string& commonName, std::time_t now, std::time_t life) {
  Identity identity{.key = Key(EVP_EC_gen("P-256")), .certificate = Certificate(X509_new())};
  if (!identity.key || !identity.certificate) return {};
  X509* certificate = identity.certificate.get();
  X509_NAME* subject = X509_get_subject_name(certificate);
  // Begins a day early, for clocks that run late.
  const bool done =
      X509_set_version(certificate, X509_VERSION_3) == 1 && setSerial(certificate) &&
      ASN1_TIME_set(X509_getm_notBefore(certificate), now - kDay) != nullptr &&
      ASN1_TIME_set(X509_getm_notAfter(certificate), now + life) != nullptr &&
      X509_set_pubkey(certificate, identity.key.get()) == 1 &&
      X509_NAME_add_entry_by_txt(subject, "CN", MBSTRING_UTF8,
                                 reinterpret_cast<const unsigned char*>(commonName.c_str()), -1, -1, 0) == 1;
  return done ? std::move(identity) : Identity{};
}

std::string randomSuffix() {
  const Number number(BN_new());
  if (!number || BN_rand(number.get(), 32, BN_RAND_TOP_ANY, BN_RAND_BOTTOM_ANY) != 1) return "";
  const std::unique_ptr<char, decltype([](char* text) { OPENSSL_free(text); })> text(BN_bn2hex(number.get()));
  return text ? text.get() : "";
}

Result<Identity> makeAuthority(std::time_t now) {
  // The suffix keeps the authorities of several labs apart in one trust folder.
  Identity identity = unsignedIdentity("Tarnel lab authority " + randomSuffix(), now, kAuthorityLife);
  X509* certificate = identity.certificate.get();
  if (certificate == nullptr || X509_set_issuer_name(certificate, X509_get_subject_name(certificate)) != 1 ||
      !addExtension(certificate, certificate, NID_basic_constraints, "critical,CA:TRUE,pathlen:0") ||
      !addExtension(certificate, certificate, NID_key_usage, "critical,keyCertSign,cRLSign") ||
      !addExtension(certificate, certificate, NID_subject_key_identifier, "hash") ||
      X509_sign(certificate, identity.key.get(), EVP_sha256()) == 0) {
    return failure("cannot make a certificate authority");
  }
  return identity;
}

Result<Identity> makeServer(const Identity& authority, const std::vector<std::string>& names,
                            std::time_t now) {
  Identity identity = unsignedIdentity("Tarnel lab", now, kServerLife);
  std::string alternatives;
  for (const std::string& name : names) {
    alternatives += (alternatives.empty() ? "" : ",") + std::string(isNumeric(name) ? "IP:" : "DNS:") + name;
  }
  X509* certificate = identity.certificate.get();
  X509* issuer = authority.certificate.get();
  if (certificate == nullptr || X509_set_issuer_name(certificate, X509_get_subject_name(issuer)) != 1 ||
      !addExtension(certificate, issuer, NID_basic_constraints, "critical,CA:FALSE") ||
      !addExtension(certificate, issuer, NID_key_usage, "critical,digitalSignature") ||
      !addExtension(certificate, issuer, NID_ext_key_usage, "serverAuth") ||
      !addExtension(certificate, issuer, NID_subject_alt_name, alternatives) ||
      !addExtension(certificate, issuer, NID_authority_key_identifier, "keyid:always") ||
      X509_sign(certificate, authority.key.get(), EVP_sha256()) == 0) {
    return failure("cannot make a server certificate for " + alternatives);
  }
  return identity;
}

Result<Identity> loadIdentity(const std::string& certificateFile, const std::string& keyFile) {
  const Result<std::string> certificateText = readFile(certificateFile, kMaxFileBytes);
  if (!certificateText) return certificateText.error();
  const Result<std::string> keyText = readFile(keyFile, kMaxFileBytes);
  if (!keyText) return keyText.error();
  const Bio certificateBio(
      BIO_new_mem_buf(certificateText->data(), static_cast<int>(certificateText->size())));
  const Bio keyBio(BIO_new_mem_buf(keyText->data(), static_cast<int>(keyText->size())));
  Identity identity{
      .key = Key(keyBio ? PEM_read_bio_PrivateKey(keyBio.get(), nullptr, noPassphrase, nullptr) : nullptr),
      .certificate =
          Certificate(certificateBio ? PEM_read_bio_X509(certificateBio.get(), nullptr, noPassphrase, nullptr)
                                     : nullptr)};
  if (!identity.certificate) return failure(certificateFile + " holds no certificate in PEM form");
  if (!identity.key) return failure(keyFile + " holds no unencrypted private key in PEM form");
  if (X509_check_private_key(identity.certificate.get(), identity.key.get()) != 1) {
    return failure(keyFile + " is not the key of " + certificateFile);
  }
  return identity;
}

MaybeError saveIdentity(const Identity& identity, const std::string& certificateFile,
                        const std::string& keyFile) {
  const auto save = [](const Bio& bio, const std::string& path, mode_t mode) {
    char* text = nullptr;
    const long size = BIO_get_mem_data(bio.get(), &text);
    return writeFile(path, std::string_view(text, static_cast<size_t>(size)), mode);
  };
  const Bio keyBio(BIO_new(BIO_s_mem()));
  const Bio certificateBio(BIO_new(BIO_s_mem()));
  if (!keyBio || !certificateBio ||
      PEM_write_bio_PKCS8PrivateKey(keyBio.get(), identity.key.get(), nullptr, nullptr, 0, nullptr,
                                    nullptr) != 1 ||
      PEM_write_bio_X509(certificateBio.get(), identity.certificate.get()) != 1) {
    return failure("cannot write a certificate as PEM");
  }
  if (MaybeError error = save(keyBio, keyFile, 0600)) return error;
  return save(certificateBio, certificateFile, 0644);
}

bool expiresBefore(const X509* certificate, std::time_t time) {
  return X509_cmp_time(X509_get0_notAfter(certificate), &time) < 0;
}

bool names(X509* certificate, const std::string& name) {
  return isNumeric(name) ? X509_check_ip_asc(certificate, name.c_str(), 0) == 1
                         : X509_check_host(certificate, name.c_str(), name.size(), 0, nullptr) == 1;
}

// Why the server certificate cannot stay, or nothing.
std::optional<std::string> reasonToRenew(const CertificateFiles& files, const Identity& authority,
                                         const std::vector<std::string>& wanted, std::time_t now) {
  if (!pathExists(files.server) && !pathExists(files.serverKey)) return "there was none";
  const Result<Identity> server = loadIdentity(files.server, files.serverKey);
  if (!server) return server.error().localizedDescription();
  X509* certificate = server->certificate.get();
  if (X509_verify(certificate, X509_get0_pubkey(authority.certificate.get())) != 1) {
    ERR_clear_error();
    return "it was signed by another authority";
  }
  if (expiresBefore(certificate, now + kRenewBefore)) return "it was about to expire";
  for (const std::string& name : wanted) {
    if (!names(certificate, name)) return "it did not name " + name;
  }
  return std::nullopt;
}

std::string remedyForAuthority(const CertificateFiles& files) {
  return "; remove " + files.authority + " and " + files.authorityKey + ", start again, and copy the new " +
         files.authority + " to every trust.d folder that held the old one";
}

}  // namespace

Result<CertificateWork> ensureCertificates(const CertificateFiles& files,
                                           const std::vector<std::string>& wanted, std::time_t now) {
  CertificateWork work;
  if (!pathExists(files.authority) && !pathExists(files.authorityKey)) {
    const Result<Identity> made = makeAuthority(now);
    if (!made) return made.error();
    if (MaybeError error = saveIdentity(*made, files.authority, files.authorityKey)) return *error;
    work.madeAuthority = true;
  }
  const Result<Identity> authority = loadIdentity(files.authority, files.authorityKey);
  if (!authority) {
    return Error(kToolErrorDomain, -1,
                 "the certificate authority cannot be used: " + authority.error().localizedDescription() +
                     remedyForAuthority(files));
  }
  if (expiresBefore(authority->certificate.get(), now + kRenewBefore)) {
    return Error(kToolErrorDomain, -1,
                 "the certificate authority in " + files.authority + " expires within 30 days" +
                     remedyForAuthority(files));
  }
  work.madeServerBecause = reasonToRenew(files, *authority, wanted, now);
  if (work.madeServerBecause) {
    const Result<Identity> server = makeServer(*authority, wanted, now);
    if (!server) return server.error();
    if (MaybeError error = saveIdentity(*server, files.server, files.serverKey)) return *error;
  }
  return work;
}

}  // namespace tarnel::lab
