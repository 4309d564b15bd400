#include "platform/linux/http/certificate_store.h"

#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/pem.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>
#include <string_view>

namespace tarnel::detail {
namespace {

constexpr size_t kLargestFile = 16U << 20U;

struct FreeBio {
  void operator()(BIO* bio) const { BIO_free_all(bio); }
};
struct FreeCertificate {
  void operator()(X509* certificate) const { X509_free(certificate); }
};

std::optional<std::string> contentsOf(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  if (!file) return std::nullopt;
  std::string contents(std::istreambuf_iterator<char>(file), {});
  if (file.bad() || contents.size() > kLargestFile) return std::nullopt;
  return contents;
}

class Loader {
 public:
  Loader() {
    result_.store.reset(X509_STORE_new());
    // A certificate of an administrator's counts also when its issuer is not at hand.
    if (result_.store != nullptr) X509_STORE_set_flags(result_.store.get(), X509_V_FLAG_PARTIAL_CHAIN);
  }

  void addFile(const std::string& path) {
    const auto pem = contentsOf(path);
    if (!pem) {
      result_.problems.push_back(path + ": cannot be read (" + std::strerror(errno) + ")");
    } else {
      addPem(*pem, path);
    }
  }

  void addPem(std::string_view pem, const std::string& origin) {
    const std::unique_ptr<BIO, FreeBio> bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    size_t count = 0;
    while (bio != nullptr && result_.store != nullptr) {
      const std::unique_ptr<X509, FreeCertificate> certificate(
          PEM_read_bio_X509_AUX(bio.get(), nullptr, nullptr, nullptr));
      if (certificate == nullptr) break;
      X509_STORE_add_cert(result_.store.get(), certificate.get());
      ++count;
    }
    const unsigned long error = ERR_peek_last_error();
    const bool atEnd = ERR_GET_LIB(error) == ERR_LIB_PEM && ERR_GET_REASON(error) == PEM_R_NO_START_LINE;
    ERR_clear_error();
    if (count == 0 || !atEnd) {
      result_.problems.push_back(
          origin + ": certificate " + std::to_string(count + 1) +
          " is no PEM certificate (\"-----BEGIN CERTIFICATE-----\"); replace the file");
    }
  }

  void addProblem(std::string text) { result_.problems.push_back(std::move(text)); }
  CertificateStore take() { return std::move(result_); }

 private:
  CertificateStore result_;
};

}  // namespace

CertificateStore loadCertificates(const std::vector<std::string>& systemFiles,
                                  const std::vector<std::string>& extraFiles,
                                  const std::vector<std::string>& extraPem) {
  Loader loader;
  const auto exists = [](const std::string& path) {
    std::error_code ignored;
    return std::filesystem::exists(path, ignored);
  };
  const auto system = std::find_if(systemFiles.begin(), systemFiles.end(), exists);
  if (system != systemFiles.end()) {
    loader.addFile(*system);
  } else if (!systemFiles.empty()) {
    loader.addProblem("the system's certificates were not found (" + systemFiles.front() +
                      "); install the package ca-certificates");
  }
  for (const auto& path : extraFiles) loader.addFile(path);
  for (const auto& pem : extraPem) loader.addPem(pem, "the given certificates");
  return loader.take();
}

}  // namespace tarnel::detail
