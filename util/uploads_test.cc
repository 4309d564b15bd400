#include "util/uploads.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <barrier>
#include <thread>

#include "platform/fake/fake_client_files.h"
#include "platform/fake/fake_http_client.h"

namespace tarnel {
namespace {

using fake::FakeHttpClient;

class UploadsTest : public ::testing::Test {
 protected:
  static UploadLimits limits(std::chrono::milliseconds wait) { return {10, 10, wait}; }

  fake::FakeClientFiles files;
  FakeHttpClient http;
};

TEST_F(UploadsTest, RoomIsGivenUpToTheBoundAndComesBack) {
  Uploads uploads(files, limits(std::chrono::milliseconds(0)));
  auto first = uploads.enter(6);
  EXPECT_TRUE(first);
  EXPECT_FALSE(uploads.enter(5));
  {
    const auto second = uploads.enter(4);
    EXPECT_TRUE(second);
    EXPECT_FALSE(uploads.enter(1));
  }
  first.reset();
  EXPECT_TRUE(uploads.enter(10));
  EXPECT_TRUE(uploads.enter(UINT64_MAX));  // alone, anything goes: it was checked against its own limit
}

TEST_F(UploadsTest, WhoWaitsGetsItsTurnInOrder) {
  Uploads uploads(files, limits(std::chrono::hours(1)));
  auto six = uploads.enter(6);
  auto four = uploads.enter(4);
  std::atomic<int> turns{0};
  std::thread large([&] {
    const auto place = uploads.enter(10);
    EXPECT_EQ(++turns, 1);
  });
  while (uploads.waiting() < 1) std::this_thread::yield();
  std::thread small([&] {
    const auto place = uploads.enter(1);
    EXPECT_EQ(++turns, 2);
  });
  while (uploads.waiting() < 2) std::this_thread::yield();
  four.reset();  // room for the small one, which came later
  six.reset();
  large.join();
  small.join();
  EXPECT_EQ(turns, 2);
  EXPECT_EQ(uploads.waiting(), 0U);
}

TEST_F(UploadsTest, UsersTakeTurns) {
  Uploads uploads(files, limits(std::chrono::hours(1)));
  auto all = uploads.enter(10, 1);
  std::mutex mutex;
  std::vector<uint32_t> turns;
  std::vector<std::thread> threads;
  // A crowd of one user's, then two of others.
  for (const uint32_t owner : {1, 1, 1, 1, 2, 3, 2}) {
    threads.emplace_back([&uploads, &mutex, &turns, owner] {
      const auto place = uploads.enter(10, owner);
      const std::lock_guard lock(mutex);
      turns.push_back(owner);
    });
    while (uploads.waiting() < threads.size()) std::this_thread::yield();
  }
  all.reset();
  for (auto& thread : threads) thread.join();
  EXPECT_THAT(turns, ::testing::ElementsAre(2, 3, 1, 2, 1, 1, 1));
}

TEST_F(UploadsTest, ThoseBehindComeInAsSoonAsThereIsRoomForAll) {
  Uploads uploads(files, limits(std::chrono::hours(1)));
  for (int round = 0; round < 50; ++round) {
    auto all = uploads.enter(10);
    std::barrier bothAreIn(2);
    const auto enter = [&uploads, &bothAreIn] {
      const auto place = uploads.enter(5);
      bothAreIn.arrive_and_wait();
    };
    std::thread first(enter);
    std::thread second(enter);
    while (uploads.waiting() < 2) std::this_thread::yield();
    all.reset();
    first.join();
    second.join();
  }
}

TEST_F(UploadsTest, OneThatGivesUpLetsTheNextGo) {
  Uploads uploads(files, limits(std::chrono::milliseconds(1)));
  const auto held = uploads.enter(5);
  EXPECT_FALSE(uploads.enter(10));
  EXPECT_TRUE(uploads.enter(5));
}

TEST_F(UploadsTest, TheAnswerEndsTheWait) {
  Uploads uploads(files);
  http.setAnswer(FakeHttpClient::status(200, "fine"));
  const auto result = uploads.perform(http, {});
  EXPECT_EQ(result.data, "fine");
  EXPECT_EQ(result.response->statusCode, 200);
}

TEST_F(UploadsTest, ARequestThatIsDroppedEndsTheWait) {
  class DroppingClient final : public HttpClient {
    void startDataTask(HttpRequest, Completion) override {}
  };
  DroppingClient dropping;
  Uploads uploads(files);
  const auto result = uploads.perform(dropping, {});
  EXPECT_EQ(result.error->localizedDescription(), "the HTTP client dropped the request");
}

TEST_F(UploadsTest, StoppingEndsEveryWaitNowAndLater) {
  Uploads uploads(files, limits(std::chrono::hours(1)));
  http.holdAnswers(true);
  const auto held = uploads.enter(10);
  std::thread waitsForRoom([&] { EXPECT_FALSE(uploads.enter(1)); });
  std::thread waitsForAnswer([&] {
    const auto result = uploads.perform(http, {});
    EXPECT_EQ(result.error->code(), kHttpClientGoingAway);
    EXPECT_EQ(result.error->localizedDescription(), "the daemon ends");
  });
  while (http.pendingCount() == 0) std::this_thread::yield();
  uploads.stop();
  waitsForRoom.join();
  waitsForAnswer.join();
  EXPECT_FALSE(uploads.enter(1));
  EXPECT_TRUE(uploads.perform(http, {}).error);
  // Answers that come now find nobody, and do no harm.
  http.answerOldest(FakeHttpClient::status(200));
  http.answerOldest(FakeHttpClient::status(200));
}

TEST_F(UploadsTest, AnAnswerMayOutliveThem) {
  http.holdAnswers(true);
  {
    Uploads uploads(files);
    uploads.stop();
    EXPECT_TRUE(uploads.perform(http, {}).error);
  }
  http.answerOldest(FakeHttpClient::status(200));
}

}  // namespace
}  // namespace tarnel
