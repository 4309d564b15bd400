#include "platform/linux/http/curl_http_client.h"

#include <atomic>
#include <cstdlib>
#include <set>
#include <stdexcept>
#include <thread>

#include "platform/linux/http/curl_test_support.h"

namespace tarnel {
namespace {

class CurlHttpClientTest : public testing::Test {
 protected:
  HttpResult perform(HttpRequest request) { return performAndWait(client_, std::move(request)); }

  QuietLog log_;
  CurlHttpClient client_{log_, plainOptions()};
};

// Keeps the requests it gets, answers each with 200.
class EchoServer {
 public:
  std::vector<std::string> requests() const {
    const std::lock_guard lock(mutex_);
    return requests_;
  }
  std::string url(std::string_view path = "/") const { return server_.url(path); }
  std::string host() const { return "127.0.0.1:" + std::to_string(server_.port()); }
  size_t connectionCount() const { return server_.connectionCount(); }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> requests_;
  RawHttpServer server_{RawHttpServer::answering([this](const std::string& request) {
    const std::lock_guard lock(mutex_);
    requests_.push_back(request);
    return httpAnswer("200 OK", "fine", "X-Answer: yes\r\n");
  })};
};

TEST_F(CurlHttpClientTest, sendsTheHeadersInTheGivenOrderAndNoneOfItsOwn) {
  EchoServer server;
  HttpRequest request = post(server.url("/path?query=1"), "body bytes");
  request.headers = {
      {"X-Z-First", "1"},       {"X-A-Second", "caf\xC3\xA9"},  {"User-Agent", "Agent/1.0 (a; b)"},
      {"X-Empty", ""},          {"Accept", "application/json"}, {"Content-Type", "application/json"},
      {"Content-Length", "10"}, {"Content-Encoding", "gzip"}};
  const HttpResult result = perform(request);
  ASSERT_FALSE(result.error) << result.error->description();
  EXPECT_EQ(server.requests().at(0),
            "POST /path?query=1 HTTP/1.1\r\nHost: " + server.host() +
                "\r\nX-Z-First: 1\r\nX-A-Second: caf\xC3\xA9\r\nUser-Agent: Agent/1.0 (a; b)"
                "\r\nX-Empty:\r\nAccept: application/json\r\nContent-Type: application/json"
                "\r\nContent-Length: 10\r\nContent-Encoding: gzip\r\n\r\nbody bytes");
}

TEST_F(CurlHttpClientTest, addsNothingToARequestWithoutHeaders) {
  EchoServer server;
  perform(get(server.url("/(null)?version=8.0")));
  perform(post(server.url(), "abc"));
  perform(post(server.url(), ""));
  HttpRequest bare = get(server.url());
  bare.method = "POST";
  perform(bare);
  bare.method = "DELETE";
  perform(bare);
  const auto host = " HTTP/1.1\r\nHost: " + server.host() + "\r\n";
  EXPECT_THAT(server.requests(), testing::ElementsAre("GET /(null)?version=8.0" + host + "\r\n",
                                                      "POST /" + host + "Content-Length: 3\r\n\r\nabc",
                                                      "POST /" + host + "Content-Length: 0\r\n\r\n",
                                                      "POST /" + host + "Content-Length: 0\r\n\r\n",
                                                      "DELETE /" + host + "\r\n"));
}

TEST_F(CurlHttpClientTest, sendsLargeBodiesWholeAndWithoutAskingFirst) {
  EchoServer server;
  const std::string body(3U << 20U, 'x');
  ASSERT_FALSE(perform(post(server.url(), body)).error);
  const std::string request = server.requests().at(0);
  EXPECT_EQ(request.find("Expect"), std::string::npos);
  EXPECT_TRUE(request.ends_with("\r\n\r\n" + body));
}

TEST_F(CurlHttpClientTest, handsOverStatusHeadersAndBody) {
  EchoServer server;
  const HttpResult result = perform(get(server.url()));
  ASSERT_FALSE(result.error);
  EXPECT_EQ(result.data, "fine");
  EXPECT_EQ(result.response->statusCode, 200);
  ASSERT_EQ(result.response->headers.size(), 2U);
  EXPECT_EQ(result.response->headers[0].name, "X-Answer");
  EXPECT_EQ(*result.response->header("x-answer"), "yes");
}

TEST_F(CurlHttpClientTest, takesEveryStatusForAnAnswer) {
  for (const int status : {204, 304, 400, 404, 499, 500, 503, 599, 600, 999}) {
    RawHttpServer server(RawHttpServer::answering([status](const std::string&) {
      return httpAnswer(std::to_string(status) + " Status", status == 204 || status == 304 ? "" : "text");
    }));
    const HttpResult result = perform(post(server.url(), "b"));
    ASSERT_FALSE(result.error) << status << result.error->description();
    EXPECT_EQ(result.response->statusCode, status);
    EXPECT_EQ(result.data, status == 204 || status == 304 ? "" : "text");
  }
}

TEST_F(CurlHttpClientTest, collectsTheHeadersOfTheFinalAnswerOnly) {
  RawHttpServer server([](RawConnection& connection) {
    connection.readRequest();
    connection.write(
        "HTTP/1.1 103 Early Hints\r\nX-Hint: 1\r\n\r\n"
        "HTTP/1.1 200 OK\r\nX-Folded: a\r\n b\r\nX-Real:  2 \r\nTransfer-Encoding: chunked\r\n\r\n"
        "3\r\nabc\r\n0\r\nX-Trailer: 3\r\n\r\n");
    connection.waitForClose();
  });
  const HttpResult result = perform(get(server.url()));
  ASSERT_FALSE(result.error);
  EXPECT_EQ(result.data, "abc");
  EXPECT_EQ(result.response->header("X-Hint"), nullptr);
  EXPECT_EQ(result.response->header("X-Trailer"), nullptr);
  EXPECT_EQ(*result.response->header("X-Real"), "2");
  EXPECT_EQ(*result.response->header("X-Folded"), "a b");
}

TEST_F(CurlHttpClientTest, leavesAnswersAsTheyWereSent) {
  const std::string packed("\x1f\x8b\x08\0not really", 14);
  RawHttpServer server(RawHttpServer::answering(
      [&packed](const std::string&) { return httpAnswer("200 OK", packed, "Content-Encoding: gzip\r\n"); }));
  EXPECT_EQ(perform(get(server.url())).data, packed);
}

TEST_F(CurlHttpClientTest, keepsAConnectionForTheNextRequest) {
  EchoServer server;
  for (int i = 0; i < 5; ++i) ASSERT_FALSE(perform(get(server.url())).error);
  EXPECT_EQ(server.connectionCount(), 1U);
}

TEST_F(CurlHttpClientTest, usesNoProxyWhateverTheEnvironmentSays) {
  EchoServer server;
  setenv("http_proxy", "http://127.0.0.1:1/", 1);
  setenv("ALL_PROXY", "http://127.0.0.1:1/", 1);
  const HttpResult result = perform(get(server.url()));
  unsetenv("http_proxy");
  unsetenv("ALL_PROXY");
  EXPECT_FALSE(result.error);
}

TEST_F(CurlHttpClientTest, carriesManyRequestsAtOnceWithinTheConnectionBound) {
  EchoServer server;
  Answers answers;
  for (int i = 0; i < 200; ++i)
    client_.startDataTask(post(server.url("/" + std::to_string(i)), "b"), answers.completion());
  for (const auto& result : answers.waitFor(200)) EXPECT_EQ(result.data, "fine");
  EXPECT_LE(server.connectionCount(), HttpClientOptions().connectionsPerHost);
  std::set<std::string> paths;
  for (const auto& request : server.requests()) paths.insert(request.substr(0, request.find(" HTTP")));
  EXPECT_EQ(paths.size(), 200U);
}

TEST_F(CurlHttpClientTest, takesRequestsFromManyThreadsAndFromCompletions) {
  EchoServer server;
  Answers answers;
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([this, &server, &answers] {
      for (int i = 0; i < 10; ++i) {
        client_.startDataTask(get(server.url()), [this, &server, &answers](HttpResult result) {
          EXPECT_FALSE(result.error);
          client_.startDataTask(get(server.url("/second")), answers.completion());
        });
        EXPECT_FALSE(perform(get(server.url())).error);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  for (const auto& result : answers.waitFor(40)) EXPECT_FALSE(result.error);
}

TEST_F(CurlHttpClientTest, outlivesACompletionThatThrows) {
  EchoServer server;
  std::binary_semaphore completing{0};
  client_.startDataTask(get(server.url()), [&completing](HttpResult) {
    completing.release();
    throw std::runtime_error("no version");
  });
  completing.acquire();
  // Completed by the same thread, and so after the failure was logged.
  EXPECT_FALSE(perform(get(server.url())).error);
  EXPECT_THAT(log_.lines(),
              testing::ElementsAre("CurlHttpClient(complete): a completion failed: no version"));
}

TEST_F(CurlHttpClientTest, needsNoCompletion) {
  EchoServer server;
  client_.startDataTask(get(server.url()), nullptr);
  EXPECT_FALSE(perform(get(server.url())).error);
}

struct RedirectCase {
  int status;
  const char* method;
  const char* methodAfter;
};

class RedirectTest : public testing::TestWithParam<RedirectCase> {};

TEST_P(RedirectTest, goesOnWithTheRightMethodBodyAndHeaders) {
  EchoServer target;
  RawHttpServer server(RawHttpServer::answering([&target](const std::string&) {
    return httpAnswer(std::to_string(GetParam().status) + " Moved", "ignored",
                      "X-Redirect: 1\r\nLocation: " + target.url("/new") + "\r\n");
  }));
  QuietLog log;
  CurlHttpClient client(log, plainOptions());
  HttpRequest request = get(server.url());
  request.method = GetParam().method;
  const bool hasBody = request.method != "GET";
  if (hasBody) request.body = std::make_shared<const std::string>("abc");
  request.headers = {{"X-Kept", "1"}, {"Authorization", "secret"}, {"Cookie", "secret"}};
  if (hasBody) request.headers.push_back({"Content-Length", "3"});
  if (hasBody) request.headers.push_back({"content-type", "text/plain"});
  const HttpResult result = performAndWait(client, request);
  ASSERT_FALSE(result.error) << result.error->description();
  EXPECT_EQ(result.data, "fine");
  EXPECT_EQ(result.response->header("X-Redirect"), nullptr);
  const std::string head =
      std::string(GetParam().methodAfter) + " /new HTTP/1.1\r\nHost: " + target.host() + "\r\nX-Kept: 1\r\n";
  const bool keepsBody = hasBody && std::string_view(GetParam().methodAfter) != "GET";
  EXPECT_EQ(target.requests().at(0),
            keepsBody ? head + "Content-Length: 3\r\ncontent-type: text/plain\r\n\r\nabc" : head + "\r\n");
}

INSTANTIATE_TEST_SUITE_P(AllStatuses, RedirectTest,
                         testing::Values(RedirectCase{301, "GET", "GET"}, RedirectCase{301, "POST", "POST"},
                                         RedirectCase{302, "POST", "POST"}, RedirectCase{303, "POST", "GET"},
                                         RedirectCase{303, "PUT", "GET"}, RedirectCase{302, "PUT", "PUT"},
                                         RedirectCase{307, "POST", "POST"}, RedirectCase{308, "POST", "POST"},
                                         RedirectCase{308, "GET", "GET"}));

// A page at the new place is no answer to what was posted.
TEST_F(CurlHttpClientTest, hasThePostsAnswerAfterAMove) {
  for (const char* status : {"301 Moved Permanently", "302 Found", "307 Temporary", "308 Permanent"}) {
    RawHttpServer server(RawHttpServer::answering([status](const std::string& request) {
      if (request.starts_with("POST /old ")) return httpAnswer(status, "", "Location: /new\r\n");
      if (request.starts_with("GET ")) return httpAnswer("200 OK", "success: a page");
      const bool isWhole = request.starts_with("POST /new ") && request.ends_with("\r\n\r\nabc");
      return httpAnswer("200 OK", isWhole ? "taken" : "incomplete");
    }));
    HttpRequest request = get(server.url("/old"));
    request.method = "POST";
    request.body = std::make_shared<const std::string>("abc");
    EXPECT_EQ(perform(request).data, "taken") << status;
  }
}

TEST_F(CurlHttpClientTest, followsRelativeRedirectsAndKeepsCredentialsOnTheSameOrigin) {
  std::vector<std::string> seen;
  RawHttpServer server(RawHttpServer::answering([&seen](const std::string& request) {
    seen.push_back(request);
    return request.starts_with("GET /a ") ? httpAnswer("302 Found", "", "Location: b?c\r\n")
                                          : httpAnswer("200 OK", "b");
  }));
  HttpRequest request = get(server.url("/a"));
  request.headers = {{"Authorization", "mine"}};
  EXPECT_EQ(perform(request).data, "b");
  EXPECT_THAT(seen.at(1), testing::StartsWith("GET /b?c HTTP/1.1\r\n"));
  EXPECT_THAT(seen.at(1), HasSubstr("Authorization: mine"));
}

TEST_F(CurlHttpClientTest, doesNotTakeEveryLocationForARedirect) {
  for (const char* status : {"201 Created", "300 Choices", "304 Not Modified", "404 Gone"}) {
    RawHttpServer server(RawHttpServer::answering([status](const std::string&) {
      return httpAnswer(status, "", "Location: http://127.0.0.1:1/\r\n");
    }));
    const HttpResult result = perform(get(server.url()));
    ASSERT_FALSE(result.error);
    EXPECT_EQ(std::to_string(result.response->statusCode), std::string(status).substr(0, 3));
  }
  RawHttpServer without(
      RawHttpServer::answering([](const std::string&) { return httpAnswer("302 Found", "x"); }));
  EXPECT_EQ(perform(get(without.url())).response->statusCode, 302);
}

TEST_F(CurlHttpClientTest, givesUpAfterTenRedirects) {
  std::atomic<int> hops = 0;
  RawHttpServer server(RawHttpServer::answering([&hops](const std::string&) {
    ++hops;
    return httpAnswer("302 Found", "", "Location: /again\r\n");
  }));
  EXPECT_EQ(errorOf(perform(get(server.url()))), "more than 10 redirects");
  EXPECT_EQ(hops, 11);
}

TEST_F(CurlHttpClientTest, refusesRedirectsToOtherSchemes) {
  for (const char* location :
       {"file:///etc/passwd", "ftp://127.0.0.1/", "gopher://127.0.0.1:1/x", "dict://a/", "data:,x"}) {
    RawHttpServer server(RawHttpServer::answering([location](const std::string&) {
      return httpAnswer("302 Found", "", "Location: " + std::string(location) + "\r\n");
    }));
    const HttpResult result = perform(get(server.url()));
    EXPECT_NE(errorOf(result), "no error") << location;
    EXPECT_FALSE(result.data);
  }
}

}  // namespace
}  // namespace tarnel
