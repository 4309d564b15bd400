#include "backends/https/https_post_backend_fixture.h"

// What the answer to a post does.

namespace tarnel {
namespace {

class HTTPSPostBackendAnswerTest : public HTTPSPostBackendFixture {
 protected:
  // What the completion was told.
  std::pair<MaybeString, MaybeError> answerWith(HTTPSPostBackend& backend, HttpResult result) {
    world.http.setAnswer(std::move(result));
    std::pair<MaybeString, MaybeError> told{"not called", std::nullopt};
    backend.postJSONMessage("{}", Flag::normal, std::nullopt, std::nullopt,
                            [&told](MaybeString text, MaybeError error) {
                              told = {std::move(text), std::move(error)};
                            });
    return told;
  }
};

TEST_F(HTTPSPostBackendAnswerTest, ServerErrorsDisableTheBackend) {
  for (const int status : {500, 503, 599}) {
    const auto backend = makeUpdated();
    const auto [text, error] = answerWith(*backend, fake::FakeHttpClient::status(status));
    const auto expected = "backend httppost disabled by server " + std::to_string(status) + " return code";
    EXPECT_EQ(backend->state(), ReportingState::disabled);
    EXPECT_EQ(text, std::nullopt);
    EXPECT_EQ(error, Error(kTarnelErrorDomain, status, expected));
    expectLog(LogLevel::information, "postJSONMessage: " + expected);
  }
}

TEST_F(HTTPSPostBackendAnswerTest, OtherAnswersLeaveTheStateAndAreNoError) {
  for (const int status : {200, 204, 301, 404, 499, 600}) {
    const auto backend = makeUpdated();
    const auto [text, error] = answerWith(*backend, fake::FakeHttpClient::status(status, "body"));
    EXPECT_EQ(backend->state(), ReportingState::enabled) << status;
    EXPECT_EQ(text, std::nullopt);
    EXPECT_EQ(error, std::nullopt);
  }
  EXPECT_TRUE(world.log.startingWith("postJSONMessage:").empty());
}

TEST_F(HTTPSPostBackendAnswerTest, TransportErrorIsLoggedAndPassedOn) {
  const auto backend = makeUpdated();
  const auto failure = fake::FakeHttpClient::failure("connection refused");
  const auto [text, error] = answerWith(*backend, failure);
  EXPECT_EQ(text, std::nullopt);
  EXPECT_EQ(error, failure.error);
  EXPECT_EQ(backend->state(), ReportingState::enabled);
  expectLog(LogLevel::error,
            "HTTPSPostBackend(postJsonMessage): post error: TarnelHTTPErrorDomain (7): connection refused");
}

// The answer's status came, then it was cut off or stood still: the status decides, and both are logged.
TEST_F(HTTPSPostBackendAnswerTest, AServerErrorWhoseBodyIsCutOffStillDisables) {
  const auto backend = makeUpdated();
  auto result = fake::FakeHttpClient::status(502);
  result.error = Error(kHttpErrorDomain, 18, "cut short");
  const auto [text, error] = answerWith(*backend, result);
  expectLog(LogLevel::error,
            "HTTPSPostBackend(postJsonMessage): post error: TarnelHTTPErrorDomain (18): cut short");
  expectLog(LogLevel::information, "postJSONMessage: backend httppost disabled by server 502 return code");
  EXPECT_EQ(backend->state(), ReportingState::disabled);
  EXPECT_EQ(text, std::nullopt);
  EXPECT_EQ(error, Error(kTarnelErrorDomain, 502, "backend httppost disabled by server 502 return code"));
}

TEST_F(HTTPSPostBackendAnswerTest, AnyOtherAnswerWhoseBodyIsCutOffTellsTheTransportsError) {
  for (const int status : {200, 404, 499, 600}) {
    const auto backend = makeUpdated();
    auto result = fake::FakeHttpClient::status(status);
    result.error = Error(kHttpErrorDomain, 18, "cut short");
    EXPECT_EQ(answerWith(*backend, result).second, result.error) << status;
    EXPECT_EQ(backend->state(), ReportingState::enabled) << status;
  }
}

TEST_F(HTTPSPostBackendAnswerTest, AnswerToAGoneBackendStillCompletes) {
  world.http.holdAnswers(true);
  auto backend = makeUpdated();
  int answers = 0;
  backend->postJSONMessage("{}", Flag::normal, std::nullopt, std::nullopt,
                           [&answers](MaybeString, MaybeError error) {
                             ++answers;
                             EXPECT_EQ(error->code(), 500);
                           });
  const std::weak_ptr<HTTPSPostBackend> gone = backend;
  backend.reset();
  EXPECT_TRUE(gone.expired());
  world.http.answerOldest(fake::FakeHttpClient::status(500));
  EXPECT_EQ(answers, 1);
  expectLog(LogLevel::information, "postJSONMessage: backend httppost disabled by server 500 return code");
}

}  // namespace
}  // namespace tarnel
