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

}  // namespace
}  // namespace tarnel
