#include <curl/curl.h>

#include <atomic>
#include <latch>
#include <thread>

#include "platform/linux/http/curl_http_client.h"
#include "platform/linux/http/curl_test_support.h"
#include "testing/waiting.h"

// Connections that are kept for the next request: what is sent on them arrives at most once.

namespace tarnel {
namespace {

using namespace std::chrono_literals;

constexpr char kNotSentAgain[] =
    "the server gave no answer; what was sent may have arrived and is not sent again";

// Answers as many requests of its first connection as it is told, reads one more and ends it; answers all
// that come on others.
class ForgetfulServer {
 public:
  explicit ForgetfulServer(int answersFirst, bool resets = false,
                           std::optional<test::TlsIdentity> identity = std::nullopt)
      : answersFirst_(answersFirst),
        resets_(resets),
        server_([this](RawConnection& connection) { serve(connection); }, std::move(identity)) {}

  size_t connectionCount() const { return server_.connectionCount(); }
  std::string url() const { return server_.url(); }
  int requests() const { return requests_; }

 private:
  void serve(RawConnection& connection) {
    const bool isFirst = connections_++ == 0;
    int answered = 0;
    while (connection.readRequest()) {
      ++requests_;
      if (isFirst && answered++ == answersFirst_) {
        if (resets_) connection.reset();
        return;
      }
      connection.write(httpAnswer("200 OK", "fine"));
    }
  }

  std::atomic<int> connections_ = 0;
  std::atomic<int> requests_ = 0;
  const int answersFirst_;
  const bool resets_;
  RawHttpServer server_;
};

class KeptConnectionTest : public testing::Test {
 protected:
  HttpResult perform(HttpRequest request) { return performAndWait(client_, std::move(request)); }
  HttpResult performAs(const char* method, HttpRequest request) {
    request.method = method;
    return perform(std::move(request));
  }

  QuietLog log_;
  CurlHttpClient client_{log_, plainOptions()};
};

TEST_F(KeptConnectionTest, aPostArrivesOnceWhenItsConnectionEndsWithoutAnAnswer) {
  for (const size_t size : {size_t{1}, size_t{1000}, size_t{3} << 20U}) {
    for (const char* method : {"POST", "PUT"}) {
      ForgetfulServer server(1);
      ASSERT_FALSE(perform(post(server.url(), "first")).error);
      const HttpResult second = performAs(method, post(server.url(), std::string(size, 'x')));
      EXPECT_EQ(errorOf(second), kNotSentAgain);
      EXPECT_EQ(second.error->code(), CURLE_GOT_NOTHING);
      EXPECT_TRUE(wasCarriedOut(second));
      EXPECT_EQ(server.requests(), 2);
      // The next has another connection.
      EXPECT_EQ(perform(post(server.url(), "third")).data, "fine");
      EXPECT_EQ(server.requests(), 3);
      EXPECT_EQ(server.connectionCount(), 2U);
    }
  }
}

TEST_F(KeptConnectionTest, aPostArrivesOnceWhenItsConnectionIsReset) {
  ForgetfulServer server(1, true);
  ASSERT_FALSE(perform(post(server.url(), "first")).error);
  EXPECT_NE(errorOf(perform(post(server.url(), "second"))), "no error");
  EXPECT_EQ(server.requests(), 2);
  EXPECT_EQ(perform(post(server.url(), "third")).data, "fine");
}

TEST_F(KeptConnectionTest, aPostArrivesOnceAlsoWhenOtherConnectionsAreKept) {
  std::latch both(2);
  std::atomic<int> requests = 0;
  RawHttpServer server([&both, &requests](RawConnection& connection) {
    while (connection.readRequest()) {
      const int number = ++requests;
      if (number <= 2) both.arrive_and_wait();
      if (number == 3) return;
      connection.write(httpAnswer("200 OK"));
    }
  });
  Answers answers;
  client_.startDataTask(post(server.url(), "1"), answers.completion());
  client_.startDataTask(post(server.url(), "2"), answers.completion());
  for (const auto& result : answers.waitFor(2)) EXPECT_FALSE(result.error);
  EXPECT_EQ(errorOf(perform(post(server.url(), "3"))), kNotSentAgain);
  EXPECT_EQ(requests, 3);
  EXPECT_EQ(server.connectionCount(), 2U);
}

TEST_F(KeptConnectionTest, aPostArrivesOnceOverTls) {
  const test::TestAuthority authority("kept connections");
  ForgetfulServer server(1, false, authority.issue());
  HttpClientOptions options = plainOptions();
  options.extraCertificates = {authority.certificatePem()};
  CurlHttpClient client(log_, options);
  ASSERT_FALSE(performAndWait(client, post(server.url(), "first")).error);
  EXPECT_NE(errorOf(performAndWait(client, post(server.url(), "second"))), "no error");
  EXPECT_EQ(server.requests(), 2);
}

TEST_F(KeptConnectionTest, whatHasNoBodyTakesAConnectionOfItsOwnUnlessItMayBeSentAgain) {
  ForgetfulServer server(1);
  ASSERT_FALSE(perform(post(server.url(), "first")).error);
  EXPECT_EQ(perform(post(server.url(), "")).data, "fine");
  EXPECT_EQ(server.connectionCount(), 2U);
  EXPECT_EQ(performAs("DELETE", get(server.url())).data, "fine");
  EXPECT_EQ(server.connectionCount(), 3U);
  EXPECT_EQ(server.requests(), 3);
}

TEST_F(KeptConnectionTest, aGetIsSentAgain) {
  for (const char* method : {"GET", "HEAD"}) {
    ForgetfulServer server(1);
    ASSERT_FALSE(perform(post(server.url(), "first")).error);
    const HttpResult second = performAs(method, get(server.url()));
    ASSERT_FALSE(second.error) << method;
    EXPECT_EQ(second.response->statusCode, 200);
    EXPECT_EQ(server.requests(), 3);
    EXPECT_EQ(server.connectionCount(), 2U);
  }
}

TEST_F(KeptConnectionTest, nothingIsSentAgainWhenANewConnectionEndsWithoutAnAnswer) {
  for (const char* body : {"first", ""}) {
    ForgetfulServer server(0);
    EXPECT_NE(errorOf(perform(post(server.url(), body))), "no error");
    EXPECT_EQ(server.requests(), 1);
  }
  ForgetfulServer server(0);
  EXPECT_NE(errorOf(perform(get(server.url()))), "no error");
  EXPECT_EQ(server.requests(), 1);
}

TEST_F(KeptConnectionTest, oneThatHasEndedIsNotUsedAgain) {
  std::atomic<int> requests = 0;
  RawHttpServer server([&requests](RawConnection& connection) {
    connection.readRequest();
    ++requests;
    connection.write(httpAnswer("200 OK"));
  });
  for (int i = 1; i <= 20; ++i) {
    const HttpResult result = perform(post(server.url(), "body"));
    ASSERT_FALSE(result.error) << result.error->description();
    EXPECT_EQ(requests, i);
    const test::Deadline deadline;
    while (server.openConnectionCount() != 0 && !deadline.passed()) std::this_thread::yield();
  }
}

TEST_F(KeptConnectionTest, oneIsGivenUpBeforeCommonServersDo) {
  EXPECT_EQ(HttpClientOptions().idleConnection, 3s);  // with what the library cuts off, almost 4
  HttpClientOptions options = plainOptions();
  options.idleConnection = 0s;  // which with what is cut off is almost one
  CurlHttpClient client(log_, options);
  RawHttpServer idle(RawHttpServer::answering([](const std::string&) { return httpAnswer("200 OK"); }));
  RawHttpServer busy(RawHttpServer::answering([](const std::string&) { return httpAnswer("200 OK"); }));
  ASSERT_FALSE(performAndWait(client, post(idle.url(), "body")).error);
  const test::Deadline deadline;
  while (idle.openConnectionCount() != 0 && !deadline.passed()) {
    ASSERT_FALSE(performAndWait(client, get(busy.url())).error);
  }
  EXPECT_EQ(idle.openConnectionCount(), 0U);
}

}  // namespace
}  // namespace tarnel
