#include "backends/https/batch_poster.h"

#include <gtest/gtest.h>

#include <functional>
#include <stdexcept>

#include "platform/fake/fake_clock.h"
#include "platform/fake/fake_http_client.h"
#include "platform/fake/fake_log.h"
#include "tarnel/keys.h"

namespace tarnel {
namespace {

// Lets a message fail while it is made.
class FailingClock final : public Clock {
 public:
  TimeValue timeOfDay() override {
    if (++asked == failsAt) throw std::runtime_error("no memory");
    return {1700000000, 0};
  }
  int asked = 0;
  int failsAt = 0;
};

class BatchPosterTest : public ::testing::Test {
 protected:
  // Of messages with one event each.
  std::shared_ptr<BatchPoster> make(int messages) {
    EventBatch batch;
    for (int i = 0; i < messages; ++i) batch.append(Dictionary{{"i", i}}, 100);
    EventBatch::Finish finish{.fields = {{"text", std::string(EventBatch::kMaxBytes, 'x')}}};
    return std::make_shared<BatchPoster>(
        std::move(batch), std::move(finish), MessageWriter{log, clock, "id", false},
        MessagePoster{*http, log, {}, "name", "https://events.example", {}},
        [this, kept = captured](const MaybeString& /*text*/, MaybeError error) {
          ++answers;
          told = std::move(error);
        });
  }
  static void post(BatchPoster& poster) {
    poster.makeFirst();
    EXPECT_FALSE(poster.takeRefused());
    poster.start();
  }
  void expectLost(size_t events) const {
    EXPECT_TRUE(log.contains(
        LogLevel::error, "HTTPSPostBackend(flushMessagesWithCompletion): name: " + std::to_string(events) +
                             " events are lost: Can not flush: no memory"));
  }

  fake::FakeLog log;
  FailingClock clock;
  std::unique_ptr<fake::FakeHttpClient> http = std::make_unique<fake::FakeHttpClient>();
  std::shared_ptr<int> captured = std::make_shared<int>();
  int answers = 0;
  MaybeError told;
};

TEST_F(BatchPosterTest, AMessageThatCannotBeMadeCostsItsEventsAndNoOther) {
  for (const int at : {1, 2, 3}) {
    log.clear();
    http->clear();
    answers = 0;
    clock.asked = 0;
    clock.failsAt = at;
    post(*make(3));
    EXPECT_EQ(http->requests().size(), 2U) << at;
    EXPECT_EQ(answers, 1);
    EXPECT_EQ(told, Error(kTarnelErrorDomain, -1, "Can not flush: no memory"));
    expectLost(1);
  }
}

// The client throws after it took the completion, and answers all the same.
TEST_F(BatchPosterTest, AnAnswerAfterAnExceptionIsNotCountedTwice) {
  class ThrowsAfterAnswer final : public HttpClient {
   public:
    void startDataTask(HttpRequest /*request*/, Completion completion) override {
      ++posts;
      completion(fake::FakeHttpClient::status(200));
      throw std::runtime_error("too late");
    }
    int posts = 0;
  } client;
  EventBatch batch;
  for (int i = 0; i < 2; ++i) batch.append(Dictionary{{"i", i}}, 100);
  const auto poster = std::make_shared<BatchPoster>(
      std::move(batch), EventBatch::Finish{.fields = {{"text", std::string(EventBatch::kMaxBytes, 'x')}}},
      MessageWriter{log, clock, "id", false}, MessagePoster{client, log, {}, "name", "https://a", {}},
      [this](const MaybeString& /*text*/, MaybeError error) {
        ++answers;
        told = std::move(error);
      });
  post(*poster);
  EXPECT_EQ(client.posts, 2);
  EXPECT_EQ(answers, 1);
  EXPECT_EQ(told, std::nullopt);
}

// As when the daemon ends: nobody is told, and nothing stays behind.
TEST_F(BatchPosterTest, AnAnswerThatNeverComesLeavesNothing) {
  http->holdAnswers(true);
  auto poster = make(3);
  post(*poster);
  const std::weak_ptr<BatchPoster> gone = poster;
  poster.reset();
  EXPECT_FALSE(gone.expired());
  EXPECT_EQ(captured.use_count(), 2);
  http.reset();
  EXPECT_TRUE(gone.expired());
  EXPECT_EQ(captured.use_count(), 1);
  EXPECT_EQ(answers, 0);
}

// Whoever has ended or gone makes room for others.
TEST_F(BatchPosterTest, PlacesAreGivenBack) {
  http->holdAnswers(true);
  for (int round = 0; round < 3; ++round) {
    std::vector<std::shared_ptr<BatchPoster>> all;
    for (size_t i = 0; i < BatchPoster::kMaxWaiting; ++i) {
      all.push_back(make(2));
      all.back()->makeFirst();
      EXPECT_FALSE(all.back()->takeRefused());
    }
    const auto single = make(1);
    single->makeFirst();
    EXPECT_FALSE(single->takeRefused());
    const auto refused = make(3);
    refused->makeFirst();
    const auto rest = refused->takeRefused();
    ASSERT_TRUE(rest);
    EXPECT_EQ(rest->size(), 2U);
    refused->start();
    http->answerOldest(fake::FakeHttpClient::status(200));
    EXPECT_EQ(told,
              Error(kTarnelErrorDomain, -1, "Can not flush all events: too many batches are being posted"));
  }
}

}  // namespace
}  // namespace tarnel
