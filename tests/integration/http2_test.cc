#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <condition_variable>
#include <map>
#include <mutex>
#include <sstream>

#include "platform/fake/fake_log.h"
#include "platform/linux/http/curl_http_client.h"
#include "testing/child_process.h"
#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/programs.h"
#include "testing/storebags.h"
#include "testing/test_certificates.h"
#include "testing/test_session.h"

// The HTTP client by itself, and in the daemon, against a server that speaks HTTP/2.

namespace tarnel::test {
namespace {

class Http2Test : public ::testing::Test {
 protected:
  void SetUp() override {
    const TlsIdentity identity = authority_.issue();
    folder_.write("certificate.pem", identity.certificatePem);
    folder_.write("key.pem", identity.keyPem);
    ProcessOptions options;
    options.program = "/usr/bin/python3";  // the one that has the system's packages
    options.arguments = {std::string(kSourceDirectory) + "/tests/integration/http2_server.py",
                         folder_.path("certificate.pem"), folder_.path("key.pem")};
    server_ = std::make_unique<ChildProcess>(options);
    ASSERT_TRUE(server_->waitForOutput("\n")) << server_->errors() << "\nscripts/setup installs python3-h2";
    std::istringstream(server_->output()) >> port_;
    HttpClientOptions client;
    client.extraCertificates = {authority_.certificatePem()};
    client.longestRequest = std::chrono::seconds(30);
    client_ = std::make_unique<CurlHttpClient>(log_, client);
  }

  std::string url(const std::string& path) const {
    return "https://127.0.0.1:" + std::to_string(port_) + path;
  }
  HttpRequest post(const std::string& path, std::string body) const {
    HttpRequest request;
    request.method = "POST";
    request.url = url(path);
    request.body = std::make_shared<const std::string>(std::move(body));
    return request;
  }
  // Starts all of them at once; the results in their order.
  std::vector<HttpResult> perform(const std::vector<HttpRequest>& requests) {
    std::mutex mutex;
    std::condition_variable changed;
    std::map<size_t, HttpResult> results;
    for (size_t i = 0; i < requests.size(); ++i) {
      client_->startDataTask(requests[i], [&mutex, &changed, &results, i](HttpResult result) {
        const std::lock_guard lock(mutex);
        results.emplace(i, std::move(result));
        changed.notify_all();
      });
    }
    std::unique_lock lock(mutex);
    changed.wait(lock, [&results, &requests] { return results.size() == requests.size(); });
    std::vector<HttpResult> inOrder;
    for (auto& [i, result] : results) inOrder.push_back(std::move(result));
    return inOrder;
  }
  static void expectAnswer(const HttpResult& result, const std::string& body) {
    ASSERT_FALSE(result.error) << result.error->description();
    EXPECT_EQ(result.response->statusCode, 202);
    ASSERT_NE(result.response->header("X-Connection"), nullptr);
    EXPECT_EQ(*result.response->header("X-Connection"), "1");
    EXPECT_TRUE(result.data == "answer to " + body);
  }
  void expectNewConnectionWorks() {
    const auto result = perform({post("/", "after")})[0];
    ASSERT_FALSE(result.error) << result.error->description();
    EXPECT_EQ(result.data, "answer to after");
  }

  const TestAuthority authority_{"Test authority"};
  const TestFolder folder_;
  fake::FakeLog log_;
  std::unique_ptr<ChildProcess> server_;
  unsigned port_ = 0;
  std::unique_ptr<CurlHttpClient> client_;
};

TEST_F(Http2Test, PostsShareOneConnectionAndEachGetsItsAnswer) {
  expectAnswer(perform({post("/", "first")})[0], "first");
  std::vector<HttpRequest> together;
  // One answers when all are there, which they only are if they share the connection.
  for (int i = 0; i < 6; ++i) together.push_back(post("/together/6", "post " + std::to_string(i)));
  const auto results = perform(together);
  for (size_t i = 0; i < results.size(); ++i) expectAnswer(results[i], "post " + std::to_string(i));
}

TEST_F(Http2Test, BodiesOfManyFramesAreCarriedWhole) {
  expectAnswer(perform({post("/", "")})[0], "");
  std::vector<HttpRequest> together;
  std::vector<std::string> bodies;
  for (const char letter : {'a', 'b', 'c'}) {
    bodies.emplace_back(300000, letter);
    together.push_back(post("/together/3", bodies.back()));
  }
  const auto results = perform(together);
  for (size_t i = 0; i < results.size(); ++i) expectAnswer(results[i], bodies[i]);
}

TEST_F(Http2Test, AStreamThatFailsCostsNoOther) {
  expectAnswer(perform({post("/", "first")})[0], "first");
  const auto results =
      perform({post("/together/2", "one"), post("/reset", "lost"), post("/together/2", "two")});
  expectAnswer(results[0], "one");
  EXPECT_TRUE(results[1].error);
  expectAnswer(results[2], "two");
}

// Also where the protocol promises that nothing was done with it: not every server keeps that promise.
TEST_F(Http2Test, APostWithoutAnAnswerIsNotSentAgain) {
  for (const std::string path : {"/refused", "/http11", "/goaway", "/gone"}) {
    ASSERT_FALSE(perform({post("/", "first")})[0].error);
    for (const std::string& body : {std::string("body"), std::string(300000, 'x')}) {
      const auto result = perform({post(path, body)})[0];
      ASSERT_TRUE(result.error) << path;
      EXPECT_TRUE(wasCarriedOut(result));
    }
    EXPECT_EQ(countOf(" " + path + "\n", server_->output()), 2U) << server_->output();
    expectNewConnectionWorks();
  }
}

TEST_F(Http2Test, TheDaemonsPostsShareOneConnectionAndItReadsTheirAnswers) {
  const LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
  lab.connect(instance);
  instance.folder().write("config/trust.d/http2.pem", authority_.certificatePem());
  instance.setConsent(true);
  const Dictionary entry = clientEntry(url("/"), url("/together/6?status=503"));
  lab.serve("brevan", storebag("1", {{"httppost", profile({entry})}}));
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {});
  ASSERT_TRUE(server_->waitForOutput("1 /\n"));  // the start message
  for (uint16_t i = 0; i < 6; ++i) {
    ASSERT_TRUE(session.send(2, i, client::Dictionary().set("i", i), client::Flag::realtime).ok());
  }
  // Which comes only once all six are there.
  EXPECT_TRUE(instance.waitForLog("postJSONMessage: backend httppost disabled by server 503 return code"));
  EXPECT_EQ(countOf("1 /together/6\n", server_->output()), 6U) << server_->output();
}

}  // namespace
}  // namespace tarnel::test
