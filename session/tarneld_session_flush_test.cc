#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "session/test_session_fixture.h"

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;

class SessionFlush : public SessionTest {
 protected:
  struct Answer {
    int calls = 0;
    MaybeString text;
    MaybeError error;
  };
  FlushReply into(Answer& answer) {
    return [&answer](MaybeString text, MaybeError error) {
      ++answer.calls;
      answer.text = std::move(text);
      answer.error = std::move(error);
    };
  }
};

TEST_F(SessionFlush, WithoutBackendsAnswersAnError) {
  Answer answer;
  session->flushMessagesWithCompletion(into(answer));
  EXPECT_EQ(answer.calls, 1);
  EXPECT_FALSE(answer.text);
  EXPECT_EQ(answer.error, Error(kTarnelErrorDomain, -1, "No backends available to send message"));
  EXPECT_TRUE(logged(LogLevel::debug, "flushMessagesWithCompletion: Flushing messages for session 0"));
  EXPECT_TRUE(
      logged(LogLevel::debug, "internalFlushMessagesWithCompletion: No backends available to send message"));
  session->flushMessagesWithCompletion(nullptr);
}

TEST_F(SessionFlush, ThreeBackendsWithoutErrorsAnswerOnceAfterTheThird) {
  offer({"httppost", "dashboard", "vesmer"});
  for (auto& [name, script] : backends.scripts) script.holdFlush = true;
  configureAndStart();
  Answer answer;
  session->flushMessagesWithCompletion(into(answer));
  backends.last("dashboard")->heldFlushes.at(0)(std::nullopt, std::nullopt);
  backends.last("vesmer")->heldFlushes.at(0)("two", std::nullopt);
  EXPECT_EQ(answer.calls, 0);
  backends.last("httppost")->heldFlushes.at(0)("three", std::nullopt);
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.text, "three");
  EXPECT_FALSE(answer.error);
}

TEST_F(SessionFlush, FirstErrorAnswersAtOnceAndTheOthersNoMore) {
  offer({"httppost", "dashboard", "vesmer"});
  for (auto& [name, script] : backends.scripts) script.holdFlush = true;
  configureAndStart();
  Answer answer;
  session->flushMessagesWithCompletion(into(answer));
  const Error error(kTarnelErrorDomain, -1, "Nothing to flush");
  backends.last("httppost")->heldFlushes.at(0)("what there was", error);
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.text, "what there was");
  EXPECT_EQ(answer.error, error);
  backends.last("dashboard")->heldFlushes.at(0)(std::nullopt, Error("other", 1, "late"));
  backends.last("vesmer")->heldFlushes.at(0)("late", std::nullopt);
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.error, error);
}

TEST_F(SessionFlush, AnErrorOfTheSecondBackendAnswersForAll) {
  offer({"httppost", "dashboard", "vesmer"});
  for (auto& [name, script] : backends.scripts) script.holdFlush = true;
  configureAndStart();
  Answer answer;
  session->flushMessagesWithCompletion(into(answer));
  backends.last("httppost")->heldFlushes.at(0)("fine", std::nullopt);
  backends.last("dashboard")->heldFlushes.at(0)(std::nullopt, Error("d", 2, "second"));
  EXPECT_EQ(answer.calls, 1);
  EXPECT_FALSE(answer.text);
  EXPECT_EQ(answer.error, Error("d", 2, "second"));
  backends.last("vesmer")->heldFlushes.at(0)("late", std::nullopt);
  EXPECT_EQ(answer.calls, 1);
}

TEST_F(SessionFlush, ABackendThatThrowsAnswersWithAnErrorAndTheOthersAreFlushed) {
  offer({"httppost", "dashboard"});
  backends.scripts["httppost"].flushThrows = true;
  backends.scripts["dashboard"].flushText = "late";
  configureAndStart();
  Answer answer;
  session->flushMessagesWithCompletion(into(answer));
  EXPECT_EQ(answer.calls, 1);
  EXPECT_FALSE(answer.text);
  EXPECT_EQ(answer.error, Error(kTarnelErrorDomain, -1, "flush went wrong"));
  EXPECT_THAT(backends.journal.lines(), ElementsAre("httppost flush", "dashboard flush"));
  EXPECT_TRUE(
      logged(LogLevel::error, "internalFlushMessagesWithCompletion: httppost failed: flush went wrong"));
}

TEST_F(SessionFlush, TheLastBackendThatThrowsStillEndsTheFlush) {
  offer({"dashboard", "httppost"});
  backends.scripts["httppost"].flushThrows = true;
  configureAndStart();
  Answer answer;
  session->flushMessagesWithCompletion(into(answer));
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.error, Error(kTarnelErrorDomain, -1, "flush went wrong"));
}

TEST_F(SessionFlush, ABackendThatThrowsAfterItHasAnsweredGivesNoSecondReply) {
  offer({"httppost", "dashboard"});
  backends.scripts["httppost"].flushThrowsAfterwards = true;
  backends.scripts["dashboard"].holdFlush = true;
  configureAndStart();
  Answer answer;
  session->flushMessagesWithCompletion(into(answer));
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.error, Error(kTarnelErrorDomain, -1, "flush went wrong"));
  backends.last("dashboard")->heldFlushes.at(0)("late", std::nullopt);
  EXPECT_EQ(answer.calls, 1);
}

TEST_F(SessionFlush, EachBackendIsLoggedAndItsTextWritten) {
  offer({"httppost", "dashboard"});
  backends.scripts["httppost"].flushText = "flushed events";
  configureAndStart();
  session->flushMessagesWithCompletion(nullptr);
  EXPECT_TRUE(logged(LogLevel::debug, "internalFlushMessagesWithCompletion: httppost"));
  EXPECT_TRUE(logged(LogLevel::debug, "internalFlushMessagesWithCompletion: dashboard"));
  EXPECT_THAT(messageLog(), ElementsAre("[httppost -> flushMessages] flushed events"));
}

TEST_F(SessionFlush, AnswersThatComeAfterTheSessionIsGoneAreHarmless) {
  offer({"httppost"});
  backends.scripts["httppost"].holdFlush = true;
  configureAndStart();
  Answer answer;
  session->flushMessagesWithCompletion(into(answer));
  const auto backend = backends.last("httppost");
  session.reset();
  backend->heldFlushes.at(0)("late", std::nullopt);
  EXPECT_EQ(answer.text, "late");
}

TEST_F(SessionFlush, AFlushWithinTheAnswerOfAFlushDoesNotHang) {
  offer({"httppost"});
  configureAndStart();
  Answer inner;
  session->flushMessagesWithCompletion([this, &inner](MaybeString /*text*/, MaybeError /*error*/) {
    session->flushMessagesWithCompletion(into(inner));
  });
  EXPECT_EQ(inner.calls, 1);
}

TEST_F(SessionFlush, AnswersOfTwoSessionsExcludeOneAnother) {
  offer({"httppost"});
  backends.scripts["httppost"].holdFlush = true;
  configureAndStart();
  const auto ones = backends.last("httppost");
  const auto other = newSession(newConnection());
  other->setSessionInfo(info(8), user(), std::nullopt, false);
  other->startConfigWithCompletionHandler(nullptr);
  const auto others = backends.last("httppost");
  // Set by the other's answer alone, read by the one's: a race, were they not kept apart by the lock.
  bool hasOtherAnswered = false;
  std::thread answering;
  session->flushMessagesWithCompletion([&](MaybeString /*text*/, MaybeError /*error*/) {
    // The other's only backend answers meanwhile. Its line comes before the lock is taken for its answer.
    world.log.clear();
    answering = std::thread([&others] { others->heldFlushes.at(0)(std::nullopt, std::nullopt); });
    while (!logged(LogLevel::debug, "internalFlushMessagesWithCompletion: httppost"))
      std::this_thread::yield();
    EXPECT_FALSE(isFree(TarneldSession::classLock()));
    EXPECT_FALSE(hasOtherAnswered);
  });
  other->flushMessagesWithCompletion([&hasOtherAnswered](MaybeString /*text*/, MaybeError /*error*/) {
    EXPECT_FALSE(isFree(TarneldSession::classLock()));
    hasOtherAnswered = true;
  });
  ones->heldFlushes.at(0)(std::nullopt, std::nullopt);
  answering.join();
  EXPECT_TRUE(hasOtherAnswered);
  EXPECT_TRUE(isFree(TarneldSession::classLock()));
}

}  // namespace
}  // namespace tarnel::fake
