#include "util/uploads.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <barrier>
#include <thread>

#include "platform/fake/fake_client_files.h"
#include "platform/fake/fake_http_client.h"
#include "testing/waiting.h"

namespace tarnel {
namespace {

using fake::FakeHttpClient;

constexpr uint32_t kOwner = 1000;

// False when it did not become true in time.
template <class Condition>
bool waitUntil(const Condition& condition) {
  const test::Deadline deadline;
  while (!condition()) {
    if (deadline.passed()) return false;
    std::this_thread::yield();
  }
  return true;
}

class UploadsTest : public ::testing::Test {
 protected:
  // Whoever waits in vain for more than this has been forgotten.
  static constexpr std::chrono::milliseconds kLong = test::kDeadline;

  static UploadLimits limits(std::chrono::milliseconds wait) { return {10, 10, wait}; }
  static void waitForWaiting(const Uploads& uploads, size_t count) {
    EXPECT_TRUE(waitUntil([&uploads, count] { return uploads.waiting() >= count; }));
  }

  fake::FakeClientFiles files;
  FakeHttpClient http;
};

TEST_F(UploadsTest, RoomIsGivenUpToTheBoundAndComesBack) {
  Uploads uploads(files, limits(std::chrono::milliseconds(0)));
  auto first = uploads.enter(6, kOwner);
  EXPECT_TRUE(first);
  EXPECT_FALSE(uploads.enter(5, kOwner));
  {
    const auto second = uploads.enter(4, kOwner);
    EXPECT_TRUE(second);
    EXPECT_FALSE(uploads.enter(1, kOwner));
  }
  first.reset();
  EXPECT_TRUE(uploads.enter(10, kOwner));
  EXPECT_TRUE(
      uploads.enter(UINT64_MAX, kOwner));  // alone, anything goes: it was checked against its own limit
}

TEST_F(UploadsTest, WhoWaitsGetsItsTurnInOrder) {
  Uploads uploads(files, limits(kLong));
  auto six = uploads.enter(6, kOwner);
  auto four = uploads.enter(4, kOwner);
  std::atomic<int> turns{0};
  std::thread large([&] {
    const auto place = uploads.enter(10, kOwner);
    EXPECT_TRUE(place);
    EXPECT_EQ(++turns, 1);
  });
  waitForWaiting(uploads, 1);
  std::thread small([&] {
    const auto place = uploads.enter(1, kOwner);
    EXPECT_EQ(++turns, 2);
  });
  waitForWaiting(uploads, 2);
  four.reset();  // room for the small one, which came later
  six.reset();
  large.join();
  small.join();
  EXPECT_EQ(turns, 2);
  EXPECT_EQ(uploads.waiting(), 0U);
}

TEST_F(UploadsTest, UsersTakeTurns) {
  Uploads uploads(files, limits(kLong));
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
    waitForWaiting(uploads, threads.size());
  }
  all.reset();
  for (auto& thread : threads) thread.join();
  EXPECT_THAT(turns, ::testing::ElementsAre(2, 3, 1, 2, 1, 1, 1));
}

TEST_F(UploadsTest, ThoseBehindComeInAsSoonAsThereIsRoomForAll) {
  Uploads uploads(files, limits(kLong));
  for (int round = 0; round < 50; ++round) {
    auto all = uploads.enter(10, kOwner);
    std::barrier bothAreIn(2);
    const auto enter = [&uploads, &bothAreIn] {
      const auto place = uploads.enter(5, kOwner);
      bothAreIn.arrive_and_wait();
    };
    std::thread first(enter);
    std::thread second(enter);
    waitForWaiting(uploads, 2);
    all.reset();
    first.join();
    second.join();
  }
}

TEST_F(UploadsTest, OneThatGivesUpLetsTheNextGo) {
  Uploads uploads(files, limits(std::chrono::milliseconds(1)));
  const auto held = uploads.enter(5, kOwner);
  EXPECT_FALSE(uploads.enter(10, kOwner));
  EXPECT_TRUE(uploads.enter(5, kOwner));
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
  Uploads uploads(files, limits(kLong));
  http.holdAnswers(true);
  const auto held = uploads.enter(10, kOwner);
  std::thread waitsForRoom([&] { EXPECT_FALSE(uploads.enter(1, kOwner)); });
  std::thread waitsForAnswer([&] {
    const auto result = uploads.perform(http, {});
    EXPECT_EQ(result.error->code(), kHttpClientGoingAway);
    EXPECT_EQ(result.error->localizedDescription(), "the daemon ends");
  });
  EXPECT_TRUE(waitUntil([this] { return http.pendingCount() == 1; }));
  uploads.stop();
  waitsForRoom.join();
  waitsForAnswer.join();
  EXPECT_FALSE(uploads.enter(1, kOwner));
  // An answer that comes now finds nobody, and does no harm.
  http.answerOldest(FakeHttpClient::status(200));
}

// The last posts of the process are waited for; nobody would be told what became of one that starts now.
TEST_F(UploadsTest, OnceStoppedNothingIsPosted) {
  Uploads uploads(files);
  http.setAnswer(FakeHttpClient::status(200));
  uploads.stop();
  const auto result = uploads.perform(http, {});
  EXPECT_EQ(result.error, Error(kHttpErrorDomain, kHttpClientGoingAway, "the daemon ends"));
  EXPECT_EQ(result.data, std::nullopt);
  EXPECT_TRUE(http.requests().empty());
}

TEST_F(UploadsTest, AnAnswerEndsItsOwnCallAlone) {
  Uploads uploads(files);
  http.holdAnswers(true);
  std::atomic<bool> secondEnded{false};
  std::thread first([&] { EXPECT_EQ(uploads.perform(http, {}).data, "one"); });
  EXPECT_TRUE(waitUntil([this] { return http.pendingCount() == 1; }));
  std::thread second([&] {
    EXPECT_EQ(uploads.perform(http, {}).data, "two");
    secondEnded = true;
  });
  EXPECT_TRUE(waitUntil([this] { return http.pendingCount() == 2; }));
  http.answerOldest(FakeHttpClient::status(200, "one"));
  first.join();
  EXPECT_FALSE(secondEnded);
  http.answerOldest(FakeHttpClient::status(200, "two"));
  second.join();
}

TEST_F(UploadsTest, AnAnswerMayOutliveThem) {
  http.holdAnswers(true);
  {
    Uploads uploads(files);
    std::thread waits([&] { EXPECT_TRUE(uploads.perform(http, {}).error); });
    EXPECT_TRUE(waitUntil([this] { return http.pendingCount() == 1; }));
    uploads.stop();
    waits.join();
  }
  http.answerOldest(FakeHttpClient::status(200));
}

}  // namespace
}  // namespace tarnel
