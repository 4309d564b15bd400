#include <curl/curl.h>

#include <future>

#include "platform/linux/http/curl_http_client.h"
#include "platform/linux/http/curl_test_support.h"
#include "testing/waiting.h"

// Requests that want no body: the status decides as soon as it is there.

namespace tarnel {
namespace {

using namespace std::chrono_literals;
using namespace std::string_literals;

class StatusTest : public testing::Test {
 protected:
  // Nothing but the status ends a request in time, unless a test says so.
  void SetUp() override { options.unwantedBody = options.noProgress = 10min; }

  static HttpRequest statusOf(std::string url, std::string body = "body") {
    HttpRequest request = post(std::move(url), std::move(body));
    request.wantsBody = false;
    return request;
  }
  HttpResult perform(HttpRequest request) const {
    QuietLog log;
    CurlHttpClient client(log, options);
    return performAndWait(client, std::move(request));
  }
  static void expectStatus(const HttpResult& result, int status) {
    EXPECT_FALSE(result.error) << result.error->description();
    EXPECT_EQ(result.data, "");
    ASSERT_TRUE(result.response);
    EXPECT_EQ(result.response->statusCode, status);
  }
  // Reads a request, says this, and waits until the client has gone.
  static RawHttpServer::Handler hangingAfter(std::string answer) {
    return [answer = std::move(answer)](RawConnection& connection) {
      connection.readRequest();
      connection.write(answer);
      connection.waitForClose();
    };
  }

  HttpClientOptions options = plainOptions();
};

TEST_F(StatusTest, aBodyThatStallsDelaysNothing) {
  for (const int status : {200, 404, 503}) {
    const std::string head = "HTTP/1.1 " + std::to_string(status) + " X\r\nX-Header: yes\r\n";
    for (const auto& rest : {"Content-Length: 1000\r\n\r\n"s, "Content-Length: 1000\r\n\r\nxxx"s,
                             "Transfer-Encoding: chunked\r\n\r\n3\r\nab"s, "\r\nuntil the end"s}) {
      RawHttpServer server(hangingAfter(head + rest));
      const HttpResult result = perform(statusOf(server.url()));
      expectStatus(result, status);
      EXPECT_EQ(*result.response->header("x-header"), "yes");
    }
  }
}

TEST_F(StatusTest, aBodyThatBreaksOffIsNoError) {
  for (const int status : {200, 503}) {
    RawHttpServer server([status](RawConnection& connection) {
      connection.readRequest();
      connection.write("HTTP/1.1 " + std::to_string(status) + " X\r\nContent-Length: 1000\r\n\r\nxxx");
    });
    expectStatus(perform(statusOf(server.url())), status);
  }
}

TEST_F(StatusTest, aBodyWithoutEndIsNoErrorAndIsNotReadToItsEnd) {
  options.maxAnswerBytes = 1000;
  std::promise<void> dropped;
  RawHttpServer server([&dropped](RawConnection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 503 X\r\n\r\n");
    while (connection.write(std::string(1000, 'x'))) {
    }
    dropped.set_value();
  });
  QuietLog log;
  CurlHttpClient client(log, options);
  expectStatus(performAndWait(client, statusOf(server.url())), 503);
  EXPECT_EQ(dropped.get_future().wait_for(test::kDeadline), std::future_status::ready);
}

TEST_F(StatusTest, aSmallBodyIsReadSoThatTheConnectionCanBeUsedAgain) {
  options.connectionsPerHost = 1;
  RawHttpServer server(RawHttpServer::answering([](const std::string&) {
    return httpAnswer("200 OK", std::string(HttpClientOptions().maxUnwantedBytes, 'x'));
  }));
  QuietLog log;
  CurlHttpClient client(log, options);
  for (int i = 0; i < 5; ++i) expectStatus(performAndWait(client, statusOf(server.url())), 200);
  EXPECT_EQ(server.connectionCount(), 1U);
}

TEST_F(StatusTest, aLargerBodyCostsItsConnection) {
  options.connectionsPerHost = 1;
  RawHttpServer server(RawHttpServer::answering([](const std::string&) {
    return httpAnswer("200 OK", std::string(HttpClientOptions().maxUnwantedBytes + 1, 'x'));
  }));
  QuietLog log;
  CurlHttpClient client(log, options);
  for (int i = 0; i < 3; ++i) expectStatus(performAndWait(client, statusOf(server.url())), 200);
  EXPECT_EQ(server.connectionCount(), 3U);
}

TEST_F(StatusTest, aBodyThatStallsHoldsItsConnectionForAMomentOnly) {
  options.connectionsPerHost = 1;
  options.unwantedBody = 50ms;
  RawHttpServer server(hangingAfter("HTTP/1.1 503 X\r\nContent-Length: 1000\r\n\r\nxxx"));
  Answers answers;
  QuietLog log;
  {
    CurlHttpClient client(log, options);
    for (int i = 0; i < 3; ++i) client.startDataTask(statusOf(server.url()), answers.completion());
    for (const auto& result : answers.waitFor(3)) expectStatus(result, 503);
  }
  EXPECT_EQ(answers.count(), 3U) << "each is completed once";
  EXPECT_EQ(server.connectionCount(), 3U);
}

TEST_F(StatusTest, anInterimAnswerDecidesNothing) {
  options.noProgress = 100ms;
  RawHttpServer server(hangingAfter("HTTP/1.1 103 Early Hints\r\nX-Hint: 1\r\n\r\n"));
  EXPECT_EQ(errorOf(perform(statusOf(server.url()))), "no byte was sent or received for 100 milliseconds");
  RawHttpServer goesOn(hangingAfter("HTTP/1.1 100 Continue\r\n\r\nHTTP/1.1 503 X\r\n\r\n"));
  expectStatus(perform(statusOf(goesOn.url())), 503);
}

TEST_F(StatusTest, aRedirectDecidesNothing) {
  RawHttpServer target(hangingAfter("HTTP/1.1 503 X\r\nContent-Length: 1000\r\n\r\n"));
  RawHttpServer server(RawHttpServer::answering([&target](const std::string&) {
    return httpAnswer("307 Elsewhere", "here", "Location: " + target.url() + "\r\n");
  }));
  expectStatus(perform(statusOf(server.url())), 503);
  options.noProgress = 100ms;
  RawHttpServer stalls(hangingAfter("HTTP/1.1 307 X\r\nLocation: /there\r\nContent-Length: 9\r\n\r\n"));
  EXPECT_EQ(errorOf(perform(statusOf(stalls.url()))), "no byte was sent or received for 100 milliseconds");
  RawHttpServer nowhere(hangingAfter("HTTP/1.1 307 X\r\nContent-Length: 9\r\n\r\n"));
  expectStatus(perform(statusOf(nowhere.url())), 307);
  RawHttpServer empty(hangingAfter("HTTP/1.1 307 X\r\nLocation: \r\nContent-Length: 9\r\n\r\n"));
  expectStatus(perform(statusOf(empty.url())), 307);
}

TEST_F(StatusTest, aServerThatRefusesEarlyIsBelieved) {
  RawHttpServer server([](RawConnection& connection) {
    connection.write("HTTP/1.1 503 X\r\nContent-Length: 1000\r\n\r\nxxx");
    connection.waitForClose();
  });
  expectStatus(perform(statusOf(server.url(), std::string(8U << 20U, 'x'))), 503);
}

TEST_F(StatusTest, aServerThatAgreesEarlyIsSentAllTheSame) {
  options.unwantedBody = 0ms;  // what is sent after the answer is not sent
  const std::string body(8U << 20U, 'x');
  std::promise<bool> isWhole;
  RawHttpServer server([&isWhole, &body](RawConnection& connection) {
    connection.write("HTTP/1.1 200 X\r\nContent-Length: 1000\r\n\r\nxxx");
    const auto request = connection.readRequest();
    isWhole.set_value(request && request->ends_with("\r\n\r\n" + body));
  });
  expectStatus(perform(statusOf(server.url(), body)), 200);
  EXPECT_TRUE(isWhole.get_future().get());
}

TEST_F(StatusTest, aConnectionThatEndsBeforeTheStatusIsAnError) {
  for (const auto& begun : {""s, "HTTP/1.1 503"s, "HTTP/1.1 503 X\r\nX: y\r\n"s}) {
    RawHttpServer server([&begun](RawConnection& connection) {
      connection.readRequest();
      connection.write(begun);
    });
    EXPECT_NE(errorOf(perform(statusOf(server.url()))), "no error") << begun;
  }
}

}  // namespace
}  // namespace tarnel
