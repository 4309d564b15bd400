#include <curl/curl.h>

#include <latch>

#include "platform/linux/http/curl_http_client.h"
#include "platform/linux/http/curl_test_support.h"

namespace tarnel {
namespace {

using namespace std::chrono_literals;
using namespace std::string_literals;

void hang(RawConnection& connection) {
  connection.readRequest();
  connection.waitForClose();
}

HttpResult performWith(const HttpClientOptions& options, HttpRequest request) {
  QuietLog log;
  CurlHttpClient client(log, options);
  return performAndWait(client, std::move(request));
}

// An answer that moves without an end.
void goOnForEver(RawConnection& connection) {
  connection.readRequest();
  connection.write("HTTP/1.1 200 OK\r\nContent-Length: 1000000000\r\n\r\n");
  while (connection.write("x")) {
  }
}

// How long a request may take in all stands beside how long it may stand still, so that the error tells which
// of the two came first.
class StallTest : public testing::Test {
 protected:
  void SetUp() override {
    options.noProgress = 100ms;
    options.longestRequest = 5000ms;
  }
  static constexpr char kStalled[] = "no byte was sent or received for 100 milliseconds";

  HttpClientOptions options = plainOptions();
};

TEST_F(StallTest, endsARequestThatIsNotAnswered) {
  RawHttpServer server(hang);
  const HttpResult result = performWith(options, post(server.url(), "body"));
  EXPECT_EQ(errorOf(result), kStalled);
  EXPECT_EQ(result.error->code(), CURLE_OPERATION_TIMEDOUT);
}

TEST_F(StallTest, asksForNoMoreThanTheSecondThatIsConfigured) {
  RawHttpServer server(hang);
  options.noProgress = 1s;
  options.longestRequest = 2500ms;
  EXPECT_EQ(errorOf(performWith(options, post(server.url(), "body"))),
            "no byte was sent or received for 1000 milliseconds");
}

TEST_F(StallTest, endsAnAnswerThatStopsInsideItsHeadersOrBody) {
  for (const auto& [begun, status] : {std::pair("HTTP/1.1 200 OK\r\nX: y\r\n"s, 0),
                                      std::pair("HTTP/1.1 200 OK\r\nContent-Length: 9\r\n\r\nabc"s, 200)}) {
    RawHttpServer server([&begun = begun](RawConnection& connection) {
      connection.readRequest();
      connection.write(begun);
      connection.waitForClose();
    });
    EXPECT_EQ(errorOf(performWith(options, get(server.url())), status), kStalled);
  }
}

TEST_F(StallTest, endsABodyThatNobodyReads) {
  std::latch done(1);
  RawHttpServer server([&done](RawConnection&) { done.wait(); });
  EXPECT_EQ(errorOf(performWith(options, post(server.url(), std::string(32U << 20U, 'x')))), kStalled);
  done.count_down();
}

TEST_F(StallTest, endsEveryHopOfARequest) {
  RawHttpServer server([](RawConnection& connection) {
    connection.readRequest();
    connection.write(httpAnswer("302 Found", "", "Location: /\r\n"));
    connection.readRequest();
    connection.waitForClose();
  });
  EXPECT_EQ(errorOf(performWith(options, get(server.url()))), kStalled);
}

TEST_F(StallTest, letsARequestGoOnWhileBytesMove) {
  options.noProgress = 500ms;
  options.longestRequest = 1200ms;
  RawHttpServer body(goOnForEver);
  options.maxAnswerBytes = options.maxHeldAnswerBytes = 2000000000;
  EXPECT_EQ(errorOf(performWith(options, get(body.url())), 200),
            "the request timed out after 1200 milliseconds");
}

TEST_F(StallTest, leavesConnectingToItsOwnLimit) {
  RawHttpServer server([](RawConnection& connection) { connection.waitForClose(); });  // no handshake
  options.connectTimeout = 400ms;
  std::string url = server.url();
  url.replace(0, 4, "https");
  const HttpResult result = performWith(options, get(url));
  EXPECT_THAT(errorOf(result), testing::AllOf(HasSubstr("onnect"), testing::Not(HasSubstr(kStalled))));
}

TEST_F(StallTest, doesNotCountTheWaitForATurn) {
  // The first holds the only connection for longer than the second might stand still.
  options.connectionsPerHost = 1;
  options.noProgress = 500ms;
  options.longestRequest = 1200ms;
  RawHttpServer server(goOnForEver);
  options.maxAnswerBytes = options.maxHeldAnswerBytes = 2000000000;
  Answers answers;  // outlives the client
  QuietLog log;
  CurlHttpClient client(log, options);
  client.startDataTask(get(server.url("/moves")), answers.completion());
  client.startDataTask(get(server.url("/waits")), answers.completion());
  const auto results = answers.waitFor(2);
  EXPECT_EQ(errorOf(results[0], 200), "the request timed out after 1200 milliseconds");
  EXPECT_EQ(errorOf(results[1]), "the request timed out after 1200 milliseconds");
}

}  // namespace
}  // namespace tarnel
