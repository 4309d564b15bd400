#include <curl/curl.h>

#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>

#include "platform/linux/http/curl_http_client.h"
#include "platform/linux/http/curl_test_support.h"

namespace tarnel {
namespace {

using test::TestAuthority;
using test::TlsIdentity;

const TestAuthority& authority() {
  static const TestAuthority one("Test authority");
  return one;
}

HttpClientOptions trusting(const TestAuthority& trusted) {
  HttpClientOptions options = plainOptions();
  options.extraCertificates = {trusted.certificatePem()};
  return options;
}

HttpResult performWith(const HttpClientOptions& options, HttpRequest request) {
  QuietLog log;
  CurlHttpClient client(log, options);
  return performAndWait(client, std::move(request));
}

RawHttpServer::Handler fine() {
  return RawHttpServer::answering([](const std::string&) { return httpAnswer("200 OK", "secret"); });
}

TEST(HttpTlsTest, trustsAnAuthorityThatItWasGiven) {
  RawHttpServer server(fine(), authority().issue());
  QuietLog log;
  CurlHttpClient client(log, trusting(authority()));
  EXPECT_FALSE(client.prepare());
  EXPECT_EQ(performAndWait(client, get(server.url())).data, "secret");
  EXPECT_EQ(performAndWait(client, get("https://localhost:" + std::to_string(server.port()))).data, "secret");
  EXPECT_EQ(performAndWait(client, get(server.url())).data, "secret");
}

TEST(HttpTlsTest, trustsFilesBesideTheSystems) {
  const auto path =
      std::filesystem::temp_directory_path() / ("tarnel-trust-" + std::to_string(getpid()) + ".pem");
  std::ofstream(path) << authority().certificatePem();
  const TestAuthority other("Other authority");
  const auto system = path.string() + ".system";
  std::ofstream(system) << other.certificatePem();
  HttpClientOptions options = plainOptions();
  options.systemCertificateFiles = {"/does/not/exist.pem", system};
  options.extraCertificateFiles = {path.string()};
  RawHttpServer server(fine(), authority().issue());
  EXPECT_EQ(performWith(options, get(server.url())).data, "secret");
  RawHttpServer systems(fine(), other.issue());
  EXPECT_EQ(performWith(options, get(systems.url())).data, "secret");
  std::filesystem::remove(path);
  std::filesystem::remove(system);
}

TEST(HttpTlsTest, trustsACertificateForItself) {
  const TlsIdentity identity = authority().issue();
  RawHttpServer server(fine(), identity);
  HttpClientOptions options = plainOptions();
  options.extraCertificates = {identity.certificatePem};
  EXPECT_EQ(performWith(options, get(server.url())).data, "secret");
}

void expectRefused(const HttpClientOptions& options, const std::string& url, const char* why) {
  const HttpResult result = performWith(options, post(url, "private"));
  EXPECT_THAT(errorOf(result), HasSubstr(why));
  EXPECT_EQ(result.error->code(), CURLE_PEER_FAILED_VERIFICATION);
}

TEST(HttpTlsTest, refusesCertificatesThatDoNotVerify) {
  std::atomic<int> requests = 0;
  const auto counting = [&requests](RawConnection& connection) {
    if (connection.readRequest()) ++requests;
  };
  const TestAuthority unknown("Unknown authority");
  RawHttpServer untrusted(counting, unknown.issue());
  expectRefused(trusting(authority()), untrusted.url(), "unable to get local issuer certificate");
  expectRefused(plainOptions(), untrusted.url(), "unable to get local issuer certificate");
  RawHttpServer expired(
      counting, authority().issue("IP:127.0.0.1", {-std::chrono::hours(48), -std::chrono::hours(24)}));
  expectRefused(trusting(authority()), expired.url(), "certificate has expired");
  RawHttpServer early(counting,
                      authority().issue("IP:127.0.0.1", {std::chrono::hours(24), std::chrono::hours(48)}));
  expectRefused(trusting(authority()), early.url(), "certificate is not yet valid");
  RawHttpServer named(counting, authority().issue("DNS:elsewhere.example"));
  expectRefused(trusting(authority()), named.url(), "no alternative certificate subject name matches");
  EXPECT_EQ(requests, 0) << "nothing is sent to a server that is not trusted";
}

TEST(HttpTlsTest, isNotMisledByAnAuthorityOfTheSameName) {
  const TestAuthority impostor("Test authority");
  RawHttpServer server(fine(), impostor.issue());
  EXPECT_NE(errorOf(performWith(trusting(authority()), get(server.url()))), "no error");
}

TEST(HttpTlsTest, neverFollowsARedirectFromHttpsToHttp) {
  std::atomic<int> requests = 0;
  RawHttpServer plain([&requests](RawConnection&) { ++requests; });
  RawHttpServer server(RawHttpServer::answering([&plain](const std::string&) {
                         return httpAnswer("302 Found", "", "Location: " + plain.url() + "\r\n");
                       }),
                       authority().issue());
  EXPECT_EQ(errorOf(performWith(trusting(authority()), get(server.url()))),
            "refused a redirect from https to \"" + plain.url() + "\", which is not encrypted");
  EXPECT_EQ(requests, 0);
}

TEST(HttpTlsTest, followsARedirectFromHttpToHttps) {
  RawHttpServer server(fine(), authority().issue());
  RawHttpServer plain(RawHttpServer::answering([&server](const std::string&) {
    return httpAnswer("301 Moved", "", "Location: " + server.url() + "\r\n");
  }));
  EXPECT_EQ(performWith(trusting(authority()), get(plain.url())).data, "secret");
}

TEST(HttpTlsTest, endsWhenTheHandshakeHangs) {
  // A server that accepts and never speaks TLS.
  RawHttpServer server([](RawConnection& connection) { connection.waitForClose(); });
  HttpClientOptions options = trusting(authority());
  options.connectTimeout = std::chrono::milliseconds(80);
  const HttpResult result = performWith(options, get("https://127.0.0.1:" + std::to_string(server.port())));
  EXPECT_EQ(result.error->code(), CURLE_OPERATION_TIMEDOUT);
}

TEST(HttpTlsTest, refusesAServerThatDoesNotSpeakTls) {
  RawHttpServer server([](RawConnection& connection) { connection.write("HTTP/1.1 200 OK\r\n\r\n"); });
  EXPECT_NE(
      errorOf(performWith(trusting(authority()), get("https://127.0.0.1:" + std::to_string(server.port())))),
      "no error");
}

TEST(HttpTlsTest, namesCertificatesThatCannotBeLoadedAndWorksWithTheRest) {
  HttpClientOptions options = trusting(authority());
  options.systemCertificateFiles = {"/does/not/exist.pem"};
  options.extraCertificateFiles = {"/does/not/exist/either.pem"};
  options.extraCertificates.push_back("no PEM");
  options.extraCertificates.push_back(authority().certificatePem() +
                                      "-----BEGIN CERTIFICATE-----\nAAAA\n-----END CERTIFICATE-----\n");
  QuietLog log;
  CurlHttpClient client(log, options);
  const MaybeError problem = client.prepare();
  ASSERT_TRUE(problem);
  const std::string& text = problem->localizedDescription();
  EXPECT_THAT(text, HasSubstr("the system's certificates were not found (/does/not/exist.pem); install"));
  EXPECT_THAT(text, HasSubstr("/does/not/exist/either.pem: cannot be read (No such file or directory)"));
  EXPECT_THAT(text, HasSubstr("the given certificates: certificate 1 is no PEM certificate"));
  EXPECT_THAT(text, HasSubstr("the given certificates: certificate 2 is no PEM certificate"));
  RawHttpServer server(fine(), authority().issue());
  EXPECT_EQ(performAndWait(client, get(server.url())).data, "secret");
}

TEST(HttpTlsTest, loadsTheSystemsCertificates) {
  if (!std::filesystem::exists(HttpClientOptions().systemCertificateFiles.front())) GTEST_SKIP();
  QuietLog log;
  CurlHttpClient client(log);
  const MaybeError problem = client.prepare();
  EXPECT_FALSE(problem) << problem->description();
}

}  // namespace
}  // namespace tarnel
