#include <atomic>
#include <thread>

#include "backends/https/https_post_backend_fixture.h"

namespace tarnel {
namespace {

class HTTPSPostBackendThreadsTest : public HTTPSPostBackendFixture {};

// Answers come on a thread of their own while the session goes on sending, updating and letting go.
TEST_F(HTTPSPostBackendThreadsTest, AnswersMeetASendingAndAReleasedBackend) {
  world.log.setActiveLevel(LogLevel::error);
  world.http.holdAnswers(true);
  entry.set("event_threshold", 0);
  constexpr int kRounds = 40;
  constexpr int kMessages = 10;
  std::atomic<int> completions{0};
  std::atomic<bool> sending{true};
  std::thread answering([this, &sending] {
    int status = 200;
    for (;;) {
      const bool last = !sending;
      while (world.http.pendingCount() > 0) {
        world.http.answerOldest(fake::FakeHttpClient::status(status));
        status = status == 200 ? 500 : 200;
      }
      if (last) return;
      std::this_thread::yield();
    }
  });
  int flushes = 0;
  for (int round = 0; round < kRounds; ++round) {
    const auto backend = makeUpdated();
    for (int i = 0; i < kMessages; ++i) {
      send(*backend, i % 3, Flag{i % 4});
      if (i % 4 == 3) backend->updateState();
    }
    ++flushes;
    backend->flushMessagesWithCompletion(
        [&completions](const MaybeString&, const MaybeError&) { ++completions; });
  }
  sending = false;
  answering.join();
  EXPECT_EQ(completions, flushes);
  EXPECT_EQ(world.http.pendingCount(), 0U);
}

// Later messages of a flush are made where the answers come, while the session changes or lets go what it
// has.
TEST_F(HTTPSPostBackendThreadsTest, LaterMessagesAreMadeBesideTheSession) {
  world.log.setActiveLevel(LogLevel::error);
  world.http.holdAnswers(true);
  world.dependencies.filterHeldEvents = true;
  constexpr int kFlushes = 4;
  constexpr size_t kMessages = 3;
  std::atomic<int> completions{0};
  std::atomic<bool> flushing{true};
  std::thread answering([this, &completions, &flushing] {
    while (flushing || completions < kFlushes) {
      if (world.http.pendingCount() > 0) world.http.answerOldest(fake::FakeHttpClient::status(200));
      std::this_thread::yield();
    }
  });
  const Dictionary large{{kTarnelUserInfoClientName, "Meetwell"},
                         {kTarnelUserInfoServiceName, "video-call"},
                         {"secret", "s"},
                         {"large", std::string(EventBatch::kMaxBytes, 'x')}};
  for (int round = 0; round < kFlushes; ++round) {
    const auto backend = makeUpdated();
    for (size_t i = 0; i < kMessages; ++i) send(*backend, static_cast<int>(i));
    backend->setUserInfoDict(large);
    backend->flushMessagesWithCompletion(
        [&completions](const MaybeString&, const MaybeError&) { ++completions; });
    backend->setUserInfoDict(userInfo);
    backend->setPostURL("https://elsewhere.example");
    backend->setHardwareType("Slate8,1");
    backend->updateState();
    send(*backend, 9);
  }
  flushing = false;
  answering.join();
  EXPECT_EQ(completions, kFlushes);
  EXPECT_EQ(world.http.requests().size(), kFlushes * kMessages);
}

// Messages of a flush are answered while their posts are still being made.
TEST_F(HTTPSPostBackendThreadsTest, AFlushOfSeveralMessagesCompletesOnce) {
  world.log.setActiveLevel(LogLevel::error);
  world.http.holdAnswers(true);
  constexpr size_t kMessages = 8;
  const auto backend = makeUpdated();
  for (size_t i = 0; i < kMessages; ++i) send(*backend, static_cast<int>(i));
  backend->setUserInfoDict(Dictionary{{"large", std::string(EventBatch::kMaxBytes, 'x')}});
  std::thread answering([this] {
    for (size_t answered = 0; answered < kMessages;) {
      if (world.http.pendingCount() == 0) {
        std::this_thread::yield();
        continue;
      }
      const bool fails = ++answered > 2;
      world.http.answerOldest(fails ? fake::FakeHttpClient::failure("number " + std::to_string(answered))
                                    : fake::FakeHttpClient::status(200));
    }
  });
  std::atomic<int> completions{0};
  MaybeError told;
  backend->flushMessagesWithCompletion([&completions, &told](MaybeString /*text*/, MaybeError error) {
    told = std::move(error);
    ++completions;
  });
  answering.join();
  EXPECT_EQ(completions, 1);
  ASSERT_TRUE(told);
  EXPECT_EQ(told->description(), fake::FakeHttpClient::failure("number 3").error->description());
  EXPECT_EQ(world.http.requests().size(), kMessages);
}

}  // namespace
}  // namespace tarnel
