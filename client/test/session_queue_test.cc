#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "client/test/session_test_fixture.h"
#include "tarnel/tarnel.h"

// Calls that wait: their order, and what bounds them.

namespace tarnel::client {
namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;

TEST_F(SessionTest, WhatWaitsTravelsTogetherInOrderAndEachGetsItsOwnAnswer) {
  stopAccepting();  // so that everything is queued before the first is sent
  Session session(options());
  std::vector<std::string> answers;
  std::promise<void> last;
  for (uint16_t i = 0; i < 200; ++i) {
    const auto completion = [&answers](const Reply& reply) { answers.push_back(reply.text.value_or("?")); };
    // Some do not care.
    ASSERT_TRUE(session.sendMessage(1, static_cast<uint16_t>(1000 + i), {}, Flag::normal,
                                    i % 3 == 0 ? Completion() : Completion(completion)));
  }
  ASSERT_TRUE(session.finish([&last](const Reply&) { last.set_value(); }));
  daemon_.stopsAccepting = false;
  daemon_.nudge();
  last.get_future().wait();

  const auto calls = daemon_.waitFor(201);
  std::vector<std::string> expected;
  for (uint16_t i = 0; i < 200; ++i) {
    EXPECT_EQ(calls[i].type, 1000 + i);
    if (i % 3 != 0) expected.push_back("sent 1/" + std::to_string(1000 + i));
  }
  EXPECT_EQ(calls[0].together, 64U);
  EXPECT_EQ(calls[199].together, 200U - 3 * 64);
  EXPECT_EQ(calls[200].member, "FinishSession");
  EXPECT_EQ(answers, expected);
}

TEST_F(SessionTest, ABatchIsBoundedInBytes) {
  stopAccepting();
  Session session(options());
  const auto payload = Dictionary().set("s", std::string(100'000, 'x'));
  for (int i = 0; i < 5; ++i) ASSERT_TRUE(session.sendMessage(1, 1, payload));
  daemon_.stopsAccepting = false;
  daemon_.nudge();
  for (const auto& call : daemon_.waitFor(5)) EXPECT_LE(call.together, 2U);
}

TEST_F(SessionTest, KeepsTheOrderOfEachOfSeveralThreads) {
  Session session(options());
  std::vector<std::thread> threads;
  for (uint16_t t = 0; t < 4; ++t) {
    threads.emplace_back([&session, t] {
      for (uint16_t i = 0; i < 500; ++i) ASSERT_TRUE(session.sendMessage(t, i));
    });
  }
  for (auto& thread : threads) thread.join();
  std::vector<uint16_t> next(4, 0);
  for (const auto& call : daemon_.waitFor(2000)) EXPECT_EQ(call.type, next.at(call.category)++);
}

TEST_F(SessionTest, NoMoreThanTheLimitIsUnanswered) {
  daemon_.isSilent = true;
  auto few = options();
  few.maxUnanswered = 3;
  few.linger = 0ms;
  Session session(std::move(few));
  std::atomic<int> completed{0};
  for (int i = 0; i < 10; ++i) {
    ASSERT_TRUE(session.sendMessage(1, 1, {}, Flag::normal, [&completed](const Reply&) { ++completed; }));
  }
  daemon_.waitFor(3);
  session = Session(options());  // the old one goes
  EXPECT_EQ(completed, 10);
  EXPECT_EQ(daemon_.received().size(), 3U);
}

TEST_F(SessionTest, AFullQueueIsAClearErrorAndNothingIsHalfAccepted) {
  stopAccepting();
  auto small = options();
  small.maxQueuedCalls = 2;
  Session session(std::move(small));
  EXPECT_TRUE(session.sendMessage(1, 1));
  EXPECT_TRUE(session.sendMessage(1, 2));
  bool wasCalled = false;
  const auto full =
      session.sendMessage(1, 3, {}, Flag::normal, [&wasCalled](const Reply&) { wasCalled = true; });
  EXPECT_EQ(full.code, TARNEL_ERROR_QUEUE_FULL);
  EXPECT_THAT(full.message, HasSubstr("queue full: 2 calls"));
  daemon_.stopsAccepting = false;
  daemon_.nudge();
  EXPECT_TRUE(session.drain(kLong));
  EXPECT_TRUE(session.sendMessage(1, 4));
  EXPECT_TRUE(session.drain(kLong));
  EXPECT_FALSE(wasCalled);
  EXPECT_EQ(daemon_.received().back().type, 4);
  EXPECT_EQ(daemon_.received().size(), 3U);
}

TEST_F(SessionTest, TheQueueIsBoundedInBytesToo) {
  stopAccepting();
  auto small = options();
  small.maxQueuedBytes = 100'000;
  Session session(std::move(small));
  const auto payload = Dictionary().set("s", std::string(60'000, 'x'));
  EXPECT_TRUE(session.sendMessage(1, 1, payload));
  EXPECT_EQ(session.sendMessage(1, 2, payload).code, TARNEL_ERROR_QUEUE_FULL);
  daemon_.stopsAccepting = false;
  daemon_.nudge();
}

TEST_F(SessionTest, RefusesWhatTheDaemonWouldNotTakeBeforeSendingIt) {
  Session session(options());
  const auto tooLarge = session.sendMessage(1, 1, Dictionary().set("s", std::string(1U << 20U, 'x')));
  EXPECT_EQ(tooLarge.code, TARNEL_ERROR_TOO_LARGE);
  EXPECT_THAT(tooLarge.message, HasSubstr("the daemon takes at most 1048576"));
  EXPECT_THAT(tooLarge.message, HasSubstr("the call takes 10488"));

  // Less of what a session keeps.
  const auto info = Dictionary().set("s", std::string(1U << 16U, 'x'));
  const auto tooMuchInfo = session.setSessionInfo(info, {});
  EXPECT_EQ(tooMuchInfo.code, TARNEL_ERROR_TOO_LARGE);
  EXPECT_THAT(tooMuchInfo.message, HasSubstr("the daemon takes at most 65536"));
  EXPECT_EQ(session.fetchStatesAndWait(info, kLong).status.code, TARNEL_ERROR_TOO_LARGE);

  // The same of a single message, whose payload does not count.
  const auto half = Dictionary().set("s", std::string(1U << 15U, 'x'));
  const auto tooMuchOfBoth = session.sendSingleMessage(half, half, 1, 1, {}, nullptr);
  EXPECT_EQ(tooMuchOfBoth.code, TARNEL_ERROR_TOO_LARGE);
  EXPECT_EQ(tooMuchOfBoth.message,
            "session info and user info take about 65634 bytes; the daemon takes at most 65536: put what is "
            "large into the payload");
  EXPECT_EQ(session.sendSingleMessage({}, info, 1, 1, {}, nullptr).code, TARNEL_ERROR_TOO_LARGE);

  const auto notText = session.sendMessage(1, 1, Dictionary().set("bad", "\xC3("));
  EXPECT_EQ(notText.code, TARNEL_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(notText.message, "this cannot be sent: at key \"bad\": the text is not UTF-8");

  const auto reply = session.sendMessageAndWait(1, 1, Dictionary().set("s", "\xFF"), Flag::normal, kLong);
  EXPECT_EQ(reply.status.code, TARNEL_ERROR_INVALID_ARGUMENT);

  EXPECT_TRUE(session.drain(kLong));
  EXPECT_TRUE(daemon_.received().empty());
}

TEST_F(SessionTest, ASingleMessagesPayloadIsNotHeldToWhatASessionKeeps) {
  Session session(options());
  const auto info = Dictionary().set("s", std::string(30'000, 'x'));
  const auto payload = Dictionary().set("s", std::string(500'000, 'x'));
  EXPECT_TRUE(session.sendSingleMessage(info, info, 1, 1, payload, nullptr));
  ASSERT_TRUE(session.drain(kLong));
  EXPECT_EQ(daemon_.received().size(), 1U);
}

TEST_F(SessionTest, TheLargestCallThatIsAcceptedArrives) {
  Session session(options());
  size_t length = (1U << 20U) - 200;
  Status status;
  do {
    status = session.sendMessage(1, 1, Dictionary().set("s", std::string(--length, 'x')));
  } while (status.code == TARNEL_ERROR_TOO_LARGE);
  ASSERT_TRUE(status);
  EXPECT_GT(length, (1U << 20U) - 512);
  ASSERT_TRUE(session.drain(kLong));
  EXPECT_EQ(daemon_.waitFor(1)[0].payload->find("s")->string()->size(), length);
}

}  // namespace
}  // namespace tarnel::client
