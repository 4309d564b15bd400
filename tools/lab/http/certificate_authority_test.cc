#include "tools/lab/http/certificate_authority.h"

#include <gmock/gmock.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <memory>

#include "tools/files/file_io.h"

namespace tarnel::lab {
namespace {

using ::testing::HasSubstr;

constexpr std::time_t kNow = 1'795'176'000;
constexpr std::time_t kDay = 86'400;

class CertificateAuthority : public ::testing::Test {
 protected:
  CertificateAuthority() { std::filesystem::create_directories(folder_); }
  ~CertificateAuthority() override { std::filesystem::remove_all(folder_); }

  using Certificate = std::unique_ptr<X509, decltype(&X509_free)>;
  static Certificate load(const std::string& path) {
    const std::unique_ptr<BIO, decltype(&BIO_free_all)> bio(BIO_new_file(path.c_str(), "r"), BIO_free_all);
    return {bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr) : nullptr, X509_free};
  }
  // OpenSSL's own verdict on the server certificate, as a TLS server at the time.
  int verdict(std::time_t time) const {
    const Certificate authority = load(files_.authority);
    const Certificate server = load(files_.server);
    const std::unique_ptr<X509_STORE, decltype(&X509_STORE_free)> store(X509_STORE_new(), X509_STORE_free);
    X509_STORE_add_cert(store.get(), authority.get());
    const std::unique_ptr<X509_STORE_CTX, decltype(&X509_STORE_CTX_free)> context(X509_STORE_CTX_new(),
                                                                                  X509_STORE_CTX_free);
    X509_STORE_CTX_init(context.get(), store.get(), server.get(), nullptr);
    X509_STORE_CTX_set_time(context.get(), 0, time);
    X509_STORE_CTX_set_purpose(context.get(), X509_PURPOSE_SSL_SERVER);
    X509_STORE_CTX_set_flags(context.get(), X509_V_FLAG_X509_STRICT);
    X509_verify_cert(context.get());
    return X509_STORE_CTX_get_error(context.get());
  }
  std::string text(const std::string& path) const { return *readFile(path, 100'000); }
  Result<CertificateWork> ensure(std::time_t now = kNow) { return ensureCertificates(files_, names_, now); }

  const std::string folder_ = ::testing::TempDir() + "tarnel_certificates_" +
                              ::testing::UnitTest::GetInstance()->current_test_info()->name();
  const CertificateFiles files_ = {.authority = folder_ + "/ca.pem",
                                   .authorityKey = folder_ + "/ca-key.pem",
                                   .server = folder_ + "/server.pem",
                                   .serverKey = folder_ + "/server-key.pem"};
  std::vector<std::string> names_ = {"localhost", "127.0.0.1", "::1"};
};

TEST_F(CertificateAuthority, MakesAChainThatVerifiesForItsNames) {
  const Result<CertificateWork> work = ensure();
  ASSERT_TRUE(work) << work.error().description();
  EXPECT_TRUE(work->madeAuthority);
  EXPECT_EQ(work->madeServerBecause, "there was none");
  EXPECT_EQ(verdict(kNow), X509_V_OK);
  const Certificate server = load(files_.server);
  EXPECT_EQ(X509_check_host(server.get(), "localhost", 0, 0, nullptr), 1);
  EXPECT_EQ(X509_check_ip_asc(server.get(), "127.0.0.1", 0), 1);
  EXPECT_EQ(X509_check_ip_asc(server.get(), "::1", 0), 1);
  EXPECT_NE(X509_check_ip_asc(server.get(), "127.0.0.2", 0), 1);
  EXPECT_NE(X509_check_ca(server.get()), 1);
}

TEST_F(CertificateAuthority, KeysAreForTheirOwnerAlone) {
  ASSERT_TRUE(ensure());
  for (const std::string& path : {files_.authorityKey, files_.serverKey}) {
    struct stat status {};
    ASSERT_EQ(::stat(path.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0600U) << path;
  }
}

TEST_F(CertificateAuthority, ReusesWhatIsThere) {
  ASSERT_TRUE(ensure());
  const std::string authority = text(files_.authority);
  const std::string server = text(files_.server);
  const Result<CertificateWork> again = ensure(kNow + 300 * kDay);
  ASSERT_TRUE(again);
  EXPECT_FALSE(again->madeAuthority);
  EXPECT_FALSE(again->madeServerBecause);
  EXPECT_EQ(text(files_.authority), authority);
  EXPECT_EQ(text(files_.server), server);
}

TEST_F(CertificateAuthority, MakesTheServerCertificateAnewBeforeItExpires) {
  ASSERT_TRUE(ensure());
  const std::string authority = text(files_.authority);
  const Result<CertificateWork> again = ensure(kNow + 380 * kDay);
  ASSERT_TRUE(again);
  EXPECT_EQ(again->madeServerBecause, "it was about to expire");
  EXPECT_EQ(text(files_.authority), authority);
  EXPECT_EQ(verdict(kNow + 500 * kDay), X509_V_OK);
}

TEST_F(CertificateAuthority, MakesItAnewForAnotherNameAuthorityOrWhenDamaged) {
  ASSERT_TRUE(ensure());
  names_.push_back("192.0.2.7");
  EXPECT_EQ(ensure()->madeServerBecause, "it did not name 192.0.2.7");
  std::filesystem::remove(files_.authority);
  std::filesystem::remove(files_.authorityKey);
  EXPECT_EQ(ensure()->madeServerBecause, "it was signed by another authority");
  std::ofstream(files_.server) << "nonsense";
  EXPECT_THAT(*ensure()->madeServerBecause, HasSubstr("holds no certificate"));
  std::filesystem::remove(files_.serverKey);
  EXPECT_TRUE(ensure()->madeServerBecause);
  EXPECT_EQ(verdict(kNow), X509_V_OK);
}

TEST_F(CertificateAuthority, ADamagedOrExpiringAuthorityIsNotReplacedUnasked) {
  ASSERT_TRUE(ensure());
  const Result<CertificateWork> late = ensure(kNow + 3640 * kDay);
  ASSERT_FALSE(late);
  EXPECT_THAT(late.error().localizedDescription(),
              HasSubstr("expires within 30 days; remove " + files_.authority));
  std::ofstream(files_.authority) << "nonsense";
  const Result<CertificateWork> damaged = ensure();
  ASSERT_FALSE(damaged);
  EXPECT_THAT(damaged.error().localizedDescription(), HasSubstr(files_.authority + " holds no certificate"));
  EXPECT_THAT(damaged.error().localizedDescription(), HasSubstr("; remove "));
  std::filesystem::remove(files_.authority);
  EXPECT_FALSE(ensure()) << "half of the pair is damage too";
}

}  // namespace
}  // namespace tarnel::lab
