#include "platform/http_client.h"

#include <string>
#include <thread>
#include <utility>

#include <gtest/gtest.h>

namespace tarnel {
namespace {

using namespace std::string_literals;

TEST(HttpResponseTest, findsTheFirstHeaderIgnoringCase) {
  const HttpResponse response{200, {{"Cache-Control", "a"}, {"cache-control", "b"}, {"X", ""}}};
  ASSERT_NE(response.header("CACHE-control"), nullptr);
  EXPECT_EQ(*response.header("CACHE-control"), "a");
  EXPECT_EQ(*response.header("x"), "");
  EXPECT_EQ(response.header("Cache"), nullptr);
  EXPECT_EQ(response.header(""), nullptr);
}

TEST(HttpResultTest, saysWhetherTheRequestWasCarriedOut) {
  const auto failure = [](const char* domain, int64_t code) {
    return HttpResult{std::nullopt, std::nullopt, Error(domain, code, "text")};
  };
  EXPECT_TRUE(wasCarriedOut({"", HttpResponse{500, {}}, std::nullopt}));
  EXPECT_TRUE(wasCarriedOut(failure(kHttpErrorDomain, 7)));
  EXPECT_TRUE(wasCarriedOut(failure("another", kHttpTooMuchQueued)));
  for (const int64_t code : {kHttpClientGoingAway, kHttpTooMuchQueued, kHttpBadRequest, kHttpNotBegun}) {
    EXPECT_FALSE(wasCarriedOut(failure(kHttpErrorDomain, code))) << code;
  }
}

TEST(HeaderSafeTest, removesControlCharactersOnly) {
  EXPECT_EQ(headerSafe("evil\r\nX-Other: 1\0\t\x7F\x1F end"s), "evilX-Other: 1 end");
  EXPECT_EQ(headerSafe("caf\xC3\xA9 ~"), "caf\xC3\xA9 ~");
  EXPECT_EQ(headerSafe(""), "");
}

// Answers on another thread, or drops the completion.
class ThreadClient final : public HttpClient {
 public:
  explicit ThreadClient(bool answers) : answers_(answers) {}
  ~ThreadClient() override { thread_.join(); }
  void startDataTask(HttpRequest request, Completion completion) override {
    thread_ = std::thread([this, request = std::move(request), completion = std::move(completion)]() mutable {
      if (answers_) completion(HttpResult{request.url, HttpResponse{204, {}}, std::nullopt});
    });
  }

 private:
  bool answers_;
  std::thread thread_;
};

TEST(PerformAndWaitTest, returnsTheAnswerOfAnotherThread) {
  ThreadClient client(true);
  HttpRequest request;
  request.url = "http://a/";
  const HttpResult result = performAndWait(client, request);
  EXPECT_EQ(result.data, "http://a/");
  EXPECT_EQ(result.response->statusCode, 204);
  EXPECT_FALSE(result.error);
}

TEST(PerformAndWaitTest, endsWithAnErrorWhenNoAnswerCanCome) {
  ThreadClient client(false);
  const HttpResult result = performAndWait(client, HttpRequest());
  ASSERT_TRUE(result.error);
  EXPECT_EQ(result.error->code(), kHttpClientGoingAway);
  EXPECT_FALSE(result.data);
  EXPECT_FALSE(result.response);
}

}  // namespace
}  // namespace tarnel
