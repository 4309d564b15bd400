#include <curl/curl.h>
#include <pthread.h>

#include <atomic>
#include <latch>
#include <thread>

#include "platform/linux/http/curl_http_client.h"
#include "platform/linux/http/curl_test_support.h"

namespace tarnel {
namespace {

using namespace std::chrono_literals;
using namespace std::string_literals;

HttpResult performWith(const HttpClientOptions& options, HttpRequest request) {
  QuietLog log;
  CurlHttpClient client(log, options);
  return performAndWait(client, std::move(request));
}

HttpResult perform(HttpRequest request) {
  return performWith(plainOptions(), std::move(request));
}

void hang(RawConnection& connection) {
  connection.readRequest();
  connection.waitForClose();
}

TEST(HttpFailureTest, refusesUrlsThatAreNotHttp) {
  EXPECT_THAT(errorOf(perform(get("file:///etc/passwd"))),
              HasSubstr("only http and https are supported, not \"file\""));
  EXPECT_THAT(errorOf(perform(get("ftp://a/b"))), HasSubstr("not \"ftp\""));
  for (const auto& url : {""s, "storebag.example/x"s, "/path"s, "http://"s, "http://a b/"s, "http://a\r\nb/"s,
                          "http://a/\0b"s, "https://[::1"s, "http://a:99999999/"s}) {
    const HttpResult result = perform(get(url));
    EXPECT_NE(errorOf(result), "no error") << url;
    EXPECT_EQ(result.error->code(), kHttpBadRequest) << url;
  }
}

TEST(HttpFailureTest, refusesHeadersThatWouldForgeOthers) {
  std::atomic<int> connections = 0;
  RawHttpServer server([&connections](RawConnection&) { ++connections; });
  const std::pair<HttpHeader, const char*> cases[] = {
      {{"X-Name", "evil\r\nX-Admin: 1"}, "the header \"X-Name\" holds control characters"},
      {{"X-Name", "evil\nX-Admin: 1"}, "control characters"},
      {{"X-Name", "evil\rX"}, "control characters"},
      {{"X-Name", "evil\0X"s}, "control characters"},
      {{"X-Name", "\x7F"}, "control characters"},
      {{"X-Name: a\r\nX-Other", "b"}, "is no header name"},
      {{"", "b"}, "\"\" is no header name"},
      {{"X Name", "b"}, "\"X Name\" is no header name"},
      {{"Content-Length", "5"}, "says 5, but the body has 3 bytes"},
      {{"content-length", "03"}, "says 03, but the body has 3 bytes"},
      {{"Transfer-Encoding", "chunked"}, "cannot be set"},
  };
  for (const auto& [header, text] : cases) {
    HttpRequest request = post(server.url(), "abc");
    request.headers = {header};
    const HttpResult result = perform(request);
    EXPECT_THAT(errorOf(result), HasSubstr(text));
    EXPECT_EQ(result.error->code(), kHttpBadRequest);
  }
  HttpRequest request = get(server.url());
  request.method = "GET / HTTP/1.1\r\nX: ";
  EXPECT_THAT(errorOf(perform(request)), HasSubstr("is no HTTP method"));
  EXPECT_EQ(connections, 0);
}

TEST(HttpFailureTest, reportsAServerThatIsNotThere) {
  std::string url;
  {
    RawHttpServer gone([](RawConnection&) {});
    url = gone.url();
  }
  const HttpResult result = perform(get(url));
  EXPECT_THAT(errorOf(result), HasSubstr("connect"));
  EXPECT_EQ(result.error->code(), CURLE_COULDNT_CONNECT);
}

TEST(HttpFailureTest, reportsANameThatDoesNotExist) {
  EXPECT_NE(errorOf(perform(get("http://name.that.does.not.exist.invalid/"))), "no error");
}

TEST(HttpFailureTest, timesOutAsTheCallerAsked) {
  RawHttpServer server(hang);
  HttpRequest request = get(server.url());
  request.timeout = 50ms;
  const HttpResult result = perform(request);
  EXPECT_EQ(errorOf(result), "the request timed out after 50 milliseconds");
  EXPECT_EQ(result.error->code(), CURLE_OPERATION_TIMEDOUT);
}

TEST(HttpFailureTest, timesOutAlsoWhileTheAnswerTrickles) {
  RawHttpServer server([](RawConnection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nContent-Length: 1000000000\r\n\r\n");
    // As fast as the client takes it, one byte at a time, so that there is always progress.
    while (connection.write("x")) {
    }
  });
  HttpClientOptions options = plainOptions();
  options.maxAnswerBytes = options.maxHeldAnswerBytes = 2000000000;
  HttpRequest request = get(server.url());
  request.timeout = 100ms;
  EXPECT_EQ(performWith(options, request).error->code(), CURLE_OPERATION_TIMEDOUT);
}

TEST(HttpFailureTest, timesOutAlsoWhileWaitingForAConnection) {
  RawHttpServer server(hang);
  HttpClientOptions options = plainOptions();
  options.connectionsPerHost = 1;
  Answers holding;  // outlives the client
  QuietLog log;
  CurlHttpClient client(log, options);
  client.startDataTask(get(server.url("/holds")), holding.completion());
  HttpRequest second = get(server.url("/waits"));
  second.timeout = 60ms;
  const HttpResult waited = performAndWait(client, second);
  EXPECT_EQ(errorOf(waited), "the request timed out after 60 milliseconds");
  EXPECT_EQ(waited.error->code(), kHttpNotBegun);
  EXPECT_EQ(holding.count(), 0U);
}

TEST(HttpFailureTest, timesOutAcrossRedirects) {
  RawHttpServer server(RawHttpServer::answering(
      [](const std::string&) { return httpAnswer("302 Found", "", "Location: /\r\n"); }));
  HttpClientOptions options = plainOptions();
  options.maxRedirects = 1000000000;
  HttpRequest request = get(server.url());
  request.timeout = 80ms;
  EXPECT_EQ(performWith(options, request).error->code(), CURLE_OPERATION_TIMEDOUT);
}

TEST(HttpFailureTest, endsARequestWithoutATimeOutOfItsOwn) {
  RawHttpServer server(hang);
  HttpClientOptions patient = plainOptions();
  patient.longestRequest = 70ms;
  EXPECT_EQ(errorOf(performWith(patient, get(server.url()))), "the request timed out after 70 milliseconds");
}

TEST(HttpFailureTest, reportsConnectionsThatBreak) {
  const std::string head = "HTTP/1.1 200 OK\r\nX: y\r\nContent-Length: 10\r\n\r\n";
  const std::string whole = head + "12345";
  for (size_t bytes = 0; bytes < whole.size(); bytes += bytes < head.size() ? 7 : 1) {
    for (const bool withReset : {false, true}) {
      RawHttpServer server([&whole, bytes, withReset](RawConnection& connection) {
        connection.readRequest();
        connection.write(std::string_view(whole).substr(0, bytes));
        if (withReset) connection.reset();
      });
      // A reset may overtake what was sent before.
      const HttpResult result = perform(get(server.url()));
      const bool isKnown = withReset ? result.response.has_value() : bytes >= head.size();
      EXPECT_NE(errorOf(result, isKnown ? 200 : 0), "no error") << bytes;
    }
  }
}

TEST(HttpFailureTest, reportsAnswersThatAreNotHttp) {
  for (const auto& bytes : {"hello\r\n\r\n"s, "\0\0\0\0"s, "HTTP/1.1 abc\r\n\r\n"s, "SSH-2.0-x\r\n"s,
                            "HTTP/1.1 200 OK\r\nContent-Length: -5\r\n\r\n"s}) {
    RawHttpServer server([&bytes](RawConnection& connection) {
      connection.readRequest();
      connection.write(bytes);
    });
    EXPECT_NE(errorOf(perform(get(server.url()))), "no error") << bytes;
  }
  RawHttpServer server([](RawConnection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\nzz\r\n");
  });
  EXPECT_NE(errorOf(perform(get(server.url())), 200), "no error");
}

TEST(HttpFailureTest, boundsAnswers) {
  HttpClientOptions options = plainOptions();
  options.maxAnswerBytes = 1000;
  const auto serving = [](size_t size) {
    return RawHttpServer::answering(
        [size](const std::string&) { return httpAnswer("200 OK", std::string(size, 'x')); });
  };
  RawHttpServer fits(serving(1000));
  EXPECT_EQ(performWith(options, get(fits.url())).data->size(), 1000U);
  RawHttpServer announced(serving(1001));
  const HttpResult result = performWith(options, get(announced.url()));
  EXPECT_EQ(errorOf(result, 200), "the answer is larger than 1000 bytes");
  EXPECT_EQ(result.error->code(), CURLE_FILESIZE_EXCEEDED);
  RawHttpServer endless([](RawConnection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\n\r\n");
    while (connection.write("xxxxxxxxxxxxxxxx")) {
    }
  });
  EXPECT_EQ(errorOf(performWith(options, get(endless.url())), 200), "the answer is larger than 1000 bytes");
}

TEST(HttpFailureTest, boundsHeaders) {
  RawHttpServer endless([](RawConnection& connection) {
    connection.readRequest();
    connection.write("HTTP/1.1 200 OK\r\n");
    while (connection.write("X-More: xxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxx\r\n")) {
    }
  });
  EXPECT_EQ(errorOf(perform(get(endless.url()))), "the answer's headers are larger than 262144 bytes");
  RawHttpServer interim([](RawConnection& connection) {
    connection.readRequest();
    while (connection.write("HTTP/1.1 103 Early Hints\r\nX: y\r\n\r\n")) {
    }
  });
  EXPECT_EQ(errorOf(perform(get(interim.url()))), "the answer's headers are larger than 262144 bytes");
}

TEST(HttpFailureTest, boundsWhatAllAnswersHoldTogether) {
  // Each answer holds 600 bytes back until both have been announced.
  std::latch both(2);
  RawHttpServer server([&both](RawConnection& connection) {
    const auto request = connection.readRequest();
    if (!request) return;
    connection.write("HTTP/1.1 200 OK\r\nContent-Length: 601\r\n\r\n" + std::string(600, 'x'));
    both.count_down();
    connection.waitForClose();
  });
  HttpClientOptions options = plainOptions();
  options.maxHeldAnswerBytes = 1000;
  Answers answers;  // outlives the client
  QuietLog log;
  CurlHttpClient client(log, options);
  client.startDataTask(get(server.url("/1")), answers.completion());
  client.startDataTask(get(server.url("/2")), answers.completion());
  EXPECT_EQ(errorOf(answers.waitFor(1)[0], 200),
            "the answers that are arriving are larger than 1000 bytes together");
}

TEST(HttpFailureTest, boundsBodiesThatWait) {
  RawHttpServer server(hang);
  HttpClientOptions options = plainOptions();
  options.maxQueuedBytes = 1000;
  Answers waiting;  // outlives the client
  QuietLog log;
  CurlHttpClient client(log, options);
  const HttpResult alone = performAndWait(client, post(server.url(), std::string(1001, 'x')));
  EXPECT_EQ(alone.error->code(), kHttpTooMuchQueued);
  HttpRequest slow = post(server.url(), std::string(600, 'x'));
  slow.timeout = 200ms;
  client.startDataTask(slow, waiting.completion());
  const HttpResult refused = performAndWait(client, post(server.url(), std::string(401, 'x')));
  EXPECT_EQ(errorOf(refused), "requests of more than 1000 bytes are under way");
  EXPECT_EQ(refused.error->code(), kHttpTooMuchQueued);
  waiting.waitFor(1);
  HttpRequest again = post(server.url(), std::string(1000, 'x'));
  again.timeout = 20ms;
  EXPECT_EQ(performAndWait(client, again).error->code(), CURLE_OPERATION_TIMEDOUT)
      << "the room is free again";
}

TEST(HttpFailureTest, boundsRequestsThatWait) {
  RawHttpServer server(hang);
  HttpClientOptions options = plainOptions();
  options.maxQueuedRequests = 3;
  Answers answers;  // outlives the client
  QuietLog log;
  CurlHttpClient client(log, options);
  for (int i = 0; i < 4; ++i) client.startDataTask(get(server.url()), answers.completion());
  EXPECT_EQ(errorOf(answers.waitFor(1)[0]), "more than 3 requests are under way");
  EXPECT_EQ(answers.count(), 1U);
}

TEST(HttpFailureTest, completesEveryRequestWhenTheClientGoesAway) {
  RawHttpServer server(hang);
  Answers answers;
  Answers late;
  QuietLog log;
  {
    CurlHttpClient client(log, plainOptions());
    for (int i = 0; i < 50; ++i) client.startDataTask(get(server.url()), answers.completion());
    client.startDataTask(get(server.url()), [&client, &server, &late](HttpResult result) {
      EXPECT_EQ(result.error->code(), kHttpClientGoingAway);
      client.startDataTask(get(server.url()), late.completion());
    });
  }
  ASSERT_EQ(answers.count(), 50U);
  for (const auto& result : answers.waitFor(50)) {
    EXPECT_EQ(errorOf(result), "the HTTP client is going away");
    EXPECT_EQ(result.error->code(), kHttpClientGoingAway);
  }
  ASSERT_EQ(late.count(), 1U);
  EXPECT_EQ(late.waitFor(1)[0].error->code(), kHttpClientGoingAway);
}

TEST(HttpFailureTest, completesEveryRequestWhenTheClientIsStopped) {
  RawHttpServer server(hang);
  Answers answers;
  QuietLog log;
  CurlHttpClient client(log, plainOptions());
  client.startDataTask(get(server.url()), answers.completion());
  client.stop();
  ASSERT_EQ(answers.count(), 1U);
  client.startDataTask(get(server.url()), answers.completion());
  for (const auto& result : answers.waitFor(2)) EXPECT_EQ(result.error->code(), kHttpClientGoingAway);
  client.stop();
}

TEST(HttpFailureTest, AClientThatWasStoppedBeforeItsFirstRequestStartsNoThread) {
  Answers answers;
  QuietLog log;
  CurlHttpClient client(log, plainOptions());
  client.stop();
  client.startDataTask(get("http://127.0.0.1:1/"), answers.completion());
  ASSERT_EQ(answers.count(), 1U) << "told before the call returns";
  EXPECT_EQ(answers.waitFor(1)[0].error->code(), kHttpClientGoingAway);
}

// New threads get a stack that no address space has room for.
class NoNewThreads {
 public:
  NoNewThreads() {
    pthread_getattr_default_np(&before_);
    pthread_attr_t huge;
    pthread_attr_init(&huge);
    pthread_attr_setstacksize(&huge, size_t{1} << 46U);
    pthread_setattr_default_np(&huge);
    pthread_attr_destroy(&huge);
  }
  NoNewThreads(const NoNewThreads&) = delete;
  NoNewThreads& operator=(const NoNewThreads&) = delete;
  ~NoNewThreads() {
    pthread_setattr_default_np(&before_);
    pthread_attr_destroy(&before_);
  }

 private:
  pthread_attr_t before_;
};

TEST(HttpFailureTest, withoutAThreadNothingIsBegun) {
  RawHttpServer server(RawHttpServer::answering([](const std::string&) { return httpAnswer("200 OK"); }));
  QuietLog log;
  CurlHttpClient client(log, plainOptions());
  {
    const NoNewThreads none;
    const HttpResult result = performAndWait(client, post(server.url(), "body"));
    EXPECT_EQ(errorOf(result), "the HTTP thread cannot be started");
    EXPECT_EQ(result.error->code(), kHttpNotBegun);
    EXPECT_FALSE(wasCarriedOut(result));
  }
  EXPECT_FALSE(performAndWait(client, post(server.url(), "body")).error) << "the next one tries again";
}

TEST(HttpFailureTest, goesAwayWithoutEverHavingWorked) {
  QuietLog log;
  CurlHttpClient client(log, plainOptions());
}

TEST(HttpFailureTest, completesOnTheClientsThreadAlsoWhenItRefuses) {
  QuietLog log;
  CurlHttpClient client(log, plainOptions());
  std::binary_semaphore done{0};
  const auto caller = std::this_thread::get_id();
  client.startDataTask(get("ftp://a/"), [&done, caller](HttpResult) {
    EXPECT_NE(std::this_thread::get_id(), caller);
    done.release();
  });
  done.acquire();
}

}  // namespace
}  // namespace tarnel
