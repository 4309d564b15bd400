#include "testing/test_certificates.h"

#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rand.h>
#include <openssl/x509v3.h>

#include <stdexcept>

namespace tarnel::test {
namespace {

using Certificate = std::unique_ptr<X509, FreeOpenSsl>;

void require(bool ok) {
  if (!ok) throw std::runtime_error("OpenSSL cannot make a test certificate");
}

std::string textOf(BIO* bio) {
  const char* text = nullptr;
  const long length = BIO_get_mem_data(bio, &text);
  return {text, static_cast<size_t>(length)};
}

std::string pemOf(X509* certificate) {
  const std::unique_ptr<BIO, decltype(&BIO_free)> bio(BIO_new(BIO_s_mem()), BIO_free);
  require(PEM_write_bio_X509(bio.get(), certificate) == 1);
  return textOf(bio.get());
}

std::string pemOf(EVP_PKEY* key) {
  const std::unique_ptr<BIO, decltype(&BIO_free)> bio(BIO_new(BIO_s_mem()), BIO_free);
  require(PEM_write_bio_PrivateKey(bio.get(), key, nullptr, nullptr, 0, nullptr, nullptr) == 1);
  return textOf(bio.get());
}

void addExtension(X509* certificate, X509* issuer, int which, const std::string& value) {
  X509V3_CTX context;
  X509V3_set_ctx(&context, issuer, certificate, nullptr, nullptr, 0);
  const std::unique_ptr<X509_EXTENSION, decltype(&X509_EXTENSION_free)> extension(
      X509V3_EXT_conf_nid(nullptr, &context, which, value.c_str()), X509_EXTENSION_free);
  require(extension != nullptr && X509_add_ext(certificate, extension.get(), -1) == 1);
}

Certificate unsignedCertificate(const std::string& commonName, EVP_PKEY* key, Validity validity) {
  Certificate certificate(X509_new());
  require(certificate != nullptr && X509_set_version(certificate.get(), 2) == 1);
  uint64_t serial = 0;
  require(RAND_bytes(reinterpret_cast<unsigned char*>(&serial), sizeof serial) == 1);
  ASN1_INTEGER_set_uint64(X509_get_serialNumber(certificate.get()), serial >> 1U);
  X509_gmtime_adj(X509_getm_notBefore(certificate.get()), validity.from.count());
  X509_gmtime_adj(X509_getm_notAfter(certificate.get()), validity.until.count());
  X509_set_pubkey(certificate.get(), key);
  X509_NAME_add_entry_by_txt(X509_get_subject_name(certificate.get()), "CN", MBSTRING_UTF8,
                             reinterpret_cast<const unsigned char*>(commonName.c_str()), -1, -1, 0);
  return certificate;
}

}  // namespace

TestAuthority::TestAuthority(const std::string& name) : key_(EVP_EC_gen("P-256")) {
  require(key_ != nullptr);
  certificate_ = unsignedCertificate(name, key_.get(), {});
  X509* const certificate = certificate_.get();
  X509_set_issuer_name(certificate, X509_get_subject_name(certificate));
  addExtension(certificate, certificate, NID_basic_constraints, "critical,CA:TRUE");
  addExtension(certificate, certificate, NID_key_usage, "critical,keyCertSign,cRLSign");
  addExtension(certificate, certificate, NID_subject_key_identifier, "hash");
  require(X509_sign(certificate, key_.get(), EVP_sha256()) != 0);
  certificatePem_ = pemOf(certificate);
}

TlsIdentity TestAuthority::issue(const std::string& names, Validity validity) const {
  const std::unique_ptr<EVP_PKEY, FreeOpenSsl> key(EVP_EC_gen("P-256"));
  require(key != nullptr);
  const Certificate certificate = unsignedCertificate("test server", key.get(), validity);
  X509_set_issuer_name(certificate.get(), X509_get_subject_name(certificate_.get()));
  addExtension(certificate.get(), certificate_.get(), NID_basic_constraints, "critical,CA:FALSE");
  addExtension(certificate.get(), certificate_.get(), NID_subject_alt_name, names);
  addExtension(certificate.get(), certificate_.get(), NID_ext_key_usage, "serverAuth");
  addExtension(certificate.get(), certificate_.get(), NID_authority_key_identifier, "keyid:always");
  require(X509_sign(certificate.get(), key_.get(), EVP_sha256()) != 0);
  return {pemOf(certificate.get()), pemOf(key.get())};
}

}  // namespace tarnel::test
