#include "daemon/counted_http_client.h"

#include <gtest/gtest.h>

#include <thread>

#include "platform/fake/fake_http_client.h"

namespace tarnel::fake {
namespace {

using std::chrono::milliseconds;

TEST(CountedHttpClient, PassesRequestAndAnswerOn) {
  FakeHttpClient http;
  CountedHttpClient counted(http);
  http.setAnswer(FakeHttpClient::status(204));
  HttpRequest request;
  request.url = "https://one.example";
  int status = 0;
  counted.startDataTask(request, [&status](HttpResult result) { status = result.response->statusCode; });
  EXPECT_EQ(status, 204);
  EXPECT_EQ(http.requests().at(0).url, "https://one.example");
  EXPECT_EQ(counted.underWay(), 0U);
}

TEST(CountedHttpClient, CountsUntilTheCompletionHasRun) {
  FakeHttpClient http;
  CountedHttpClient counted(http);
  http.holdAnswers(true);
  size_t within = 0;
  counted.startDataTask({}, [&counted, &within](HttpResult /*result*/) { within = counted.underWay(); });
  counted.startDataTask({}, nullptr);
  EXPECT_EQ(counted.underWay(), 2U);
  EXPECT_FALSE(counted.waitUntilNone(milliseconds(0)));
  http.answerOldest(FakeHttpClient::status(200));
  EXPECT_EQ(within, 2U);
  EXPECT_EQ(counted.underWay(), 1U);
  http.answerOldest(FakeHttpClient::status(200));
  EXPECT_TRUE(counted.waitUntilNone(milliseconds(0)));
}

TEST(CountedHttpClient, AnswersAfterItsEndAreHarmless) {
  FakeHttpClient http;
  http.holdAnswers(true);
  bool answered = false;
  {
    CountedHttpClient counted(http);
    counted.startDataTask({}, [&answered](HttpResult /*result*/) { answered = true; });
  }
  http.answerOldest(FakeHttpClient::status(200));
  EXPECT_TRUE(answered);
}

TEST(CountedHttpClient, WaitingEndsWithTheLastAnswer) {
  FakeHttpClient http;
  CountedHttpClient counted(http);
  http.holdAnswers(true);
  counted.startDataTask({}, nullptr);
  std::thread answering([&http] { http.answerOldest(FakeHttpClient::status(200)); });
  EXPECT_TRUE(counted.waitUntilNone(std::chrono::minutes(1)));
  answering.join();
}

}  // namespace
}  // namespace tarnel::fake
