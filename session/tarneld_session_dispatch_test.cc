#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "session/test_session_fixture.h"

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

const SentObject kText = std::string("what was sent");

class SessionDispatch : public SessionTest {
 protected:
  MaybeSentObject send(const MaybeDictionary& payload = Dictionary{{"a", 1}}) {
    MaybeSentObject answer;
    bool called = false;
    session->sendMessageWithCategory(3, 4, payload, [&](MaybeSentObject sent) {
      called = true;
      answer = std::move(sent);
    });
    EXPECT_TRUE(called);
    return answer;
  }
  MaybeSentObject sendDictionary(Dictionary message) {
    MaybeSentObject answer;
    bool called = false;
    session->sendMessageWithDictionary(std::move(message), [&](MaybeSentObject sent) {
      called = true;
      answer = std::move(sent);
    });
    EXPECT_TRUE(called);
    return answer;
  }
  static SentObject failure(const std::string& description) {
    return Error(kTarnelErrorDomain, -1, description);
  }
  const FakeBackend::Sent& lastSent(const char* name = kTarnelBackendHTTPPost) {
    return backends.last(name)->sent.back();
  }
};

TEST_F(SessionDispatch, MessageWithoutBackendsLogsOnlyThat) {
  world.log.clear();
  EXPECT_FALSE(sendDictionary({}));
  EXPECT_THAT(
      world.log.lines(),
      ElementsAre(FakeLog::Line{LogLevel::debug, "sendMessageWithCategory: Sending message for session 0"},
                  FakeLog::Line{LogLevel::debug,
                                "sendMessageWithDictionary: No backends available to send message"}));
  EXPECT_FALSE(send());
  EXPECT_EQ(
      world.log.count(LogLevel::debug, "sendMessageWithDictionary: No backends available to send message"),
      2U);
}

TEST_F(SessionDispatch, CategoryAndTypeAreMandatory) {
  offer({kTarnelBackendHTTPPost});
  configureAndStart();
  EXPECT_FALSE(sendDictionary({{kTarnelMessageParametersType, 1}}));
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithDictionary: Missing mandatory parameter 'category'"));
  EXPECT_FALSE(logged(LogLevel::debug, "sendMessageWithDictionary: Missing mandatory parameter 'type'"));
  EXPECT_FALSE(sendDictionary({{kTarnelMessageParametersCategory, 1}}));
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithDictionary: Missing mandatory parameter 'type'"));
  EXPECT_THAT(backends.journal.lines(), IsEmpty());
}

TEST_F(SessionDispatch, DictionaryIsReadAsNumbersWithTheirLowSixteenBits) {
  offer({kTarnelBackendHTTPPost});
  configureAndStart();
  world.clock.set({1700000123, 250000});
  sendDictionary({{kTarnelMessageParametersCategory, 0x1FFFF},
                  {kTarnelMessageParametersType, "12 and more"},
                  {kTarnelMessageParametersPayload, Dictionary{{"a", 1}}},
                  {kTarnelMessageParametersFlag, 3}});
  const auto& sent = lastSent();
  EXPECT_EQ(sent.method, Method{0xFFFF});
  EXPECT_EQ(sent.respCode, RespCode{12});
  EXPECT_EQ(sent.payload, (Dictionary{{"a", 1}}));
  EXPECT_EQ(sent.flag, Flag{3});
  EXPECT_EQ(sent.timestamp, (TimeValue{1700000123, 250000}));
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithCategory: Sending message for session 7"));
}

TEST_F(SessionDispatch, FlagAndPayloadAreOptional) {
  offer({kTarnelBackendHTTPPost});
  configureAndStart();
  sendDictionary({{kTarnelMessageParametersCategory, 1}, {kTarnelMessageParametersType, 2}});
  EXPECT_EQ(lastSent().flag, Flag::normal);
  EXPECT_FALSE(lastSent().payload);
  sendDictionary({{kTarnelMessageParametersCategory, 1},
                  {kTarnelMessageParametersType, 2},
                  {kTarnelMessageParametersPayload, "no dictionary"}});
  EXPECT_FALSE(lastSent().payload);
}

TEST_F(SessionDispatch, CategoryFormHandsOnItsArgumentsWithFlagZero) {
  offer({kTarnelBackendHTTPPost});
  configureAndStart();
  send(Dictionary{{"a", 1}});
  EXPECT_EQ(lastSent().method, Method{3});
  EXPECT_EQ(lastSent().respCode, RespCode{4});
  EXPECT_EQ(lastSent().flag, Flag::normal);
  EXPECT_EQ(lastSent().payload, (Dictionary{{"a", 1}}));
  send(std::nullopt);
  EXPECT_FALSE(lastSent().payload);
  EXPECT_EQ(world.log.count(LogLevel::debug, "sendMessageWithCategory: Sending message for session 7"), 2U);
}

TEST_F(SessionDispatch, EveryBackendGetsTheMessageInTheStorebagsOrder) {
  offer({"vesmer", "httppost2", "dashboard", "httppost"});
  configureAndStart();
  send();
  EXPECT_THAT(backends.journal.lines(), ElementsAre("vesmer send 3/4", "httppost2 send 3/4",
                                                    "dashboard send 3/4", "httppost send 3/4"));
}

TEST_F(SessionDispatch, WhatABackendReturnsGoesToTheMessageLog) {
  offer({"httppost2", "httppost"});
  backends.scripts["httppost2"].sends = kText;
  backends.scripts["httppost"].sends = failure("went wrong");
  configureAndStart();
  world.files.files.clear();
  send();
  EXPECT_THAT(messageLog(),
              ElementsAre("[httppost2 -> sendMessageWithDictionary] what was sent",
                          "[httppost -> sendMessageWithDictionary] TarnelErrorDomain (-1): went wrong"));
}

TEST_F(SessionDispatch, NothingReturnedIsNothingLogged) {
  offer({"httppost"});
  configureAndStart();
  EXPECT_FALSE(send());
  EXPECT_THAT(messageLog(), IsEmpty());
}

TEST_F(SessionDispatch, HttpPostWinsOverTheDashboardInEitherOrder) {
  for (const auto& order : {Lines{"dashboard", "httppost"}, Lines{"httppost", "dashboard"}}) {
    offer(order);
    backends.scripts["dashboard"].sends = failure("dashboard");
    backends.scripts["httppost"].sends = failure("httppost");
    configureAndStart();
    EXPECT_EQ(send(), MaybeSentObject(failure("httppost")));
  }
}

TEST_F(SessionDispatch, DashboardIsTakenWhenHttpPostReturnsNothing) {
  for (const auto& order : {Lines{"dashboard", "httppost"}, Lines{"httppost", "dashboard"}}) {
    offer(order);
    backends.scripts["dashboard"].sends = failure("dashboard");
    configureAndStart();
    EXPECT_EQ(send(), MaybeSentObject(failure("dashboard")));
  }
}

TEST_F(SessionDispatch, OtherBackendsAreOnlyLogged) {
  offer({"httppost2", "dravik", "vesmer", "uploadserver"});
  for (auto& [name, script] : backends.scripts) script.sends = kText;
  configureAndStart();
  world.files.files.clear();
  EXPECT_FALSE(send());
  EXPECT_EQ(messageLog().size(), 4U);
}

TEST_F(SessionDispatch, ATextIsHandedToTheClientAsItStands) {
  offer({"httppost"});
  backends.scripts["httppost"].sends = kText;
  configureAndStart();
  EXPECT_EQ(send(), MaybeSentObject(kText));
  EXPECT_EQ(sendDictionary({{kTarnelMessageParametersCategory, 1}, {kTarnelMessageParametersType, 2}}),
            MaybeSentObject(kText));
}

TEST_F(SessionDispatch, InternalMessagesAreStampedWhenTheyAreDispatched) {
  offer({"httppost"});
  configureAndStart();
  world.clock.set({1700000500, 0});
  session->internalSendMessage(Dictionary{{"x", 1}}, TimeValue{1, 0}, Method{0}, RespCode{1});
  EXPECT_EQ(lastSent().timestamp, (TimeValue{1700000500, 0}));
  EXPECT_TRUE(logged(LogLevel::debug, "internalSendMessage: Sent internal message (method:0 respCode:1)"));
  EXPECT_FALSE(logged(LogLevel::debug, "sendMessageWithCategory: Sending message for session 7"));
}

// Aggregation.

TEST_F(SessionDispatch, OwnAggregatorGetsTheMessageWithUserInfoOverIt) {
  offer({"httppost"});
  configureAndStart(true);
  world.clock.set({1700000123, 500000});
  send(Dictionary{{"a", 1}, {kTarnelUserInfoClientName, "from payload"}});
  ASSERT_EQ(connection->received().size(), 2U);  // the start message and this one
  const auto message = connection->received().back();
  EXPECT_EQ(message.messageInfo, info());
  EXPECT_DOUBLE_EQ(message.timestamp, 1700000123.5);
  EXPECT_EQ(message.category, 3);
  EXPECT_EQ(message.type, 4);
  EXPECT_EQ(
      message.payload,
      (Dictionary{{"a", 1}, {kTarnelUserInfoClientName, "Phone"}, {kTarnelUserInfoServiceName, "Call"}}));
  EXPECT_EQ(lastSent().payload, (Dictionary{{"a", 1}, {kTarnelUserInfoClientName, "from payload"}}));
}

TEST_F(SessionDispatch, NoPayloadReachesTheAggregatorAsNone) {
  offer({"httppost"});
  configureAndStart(true);
  send(std::nullopt);
  EXPECT_FALSE(connection->received().back().payload);
}

TEST_F(SessionDispatch, AncestorGetsTheMessageInsteadOfTheOwnClient) {
  offer({"httppost"});
  backends.scripts["httppost"].hierarchy = 1;
  const auto ancestorConnection = std::make_shared<FakeConnection>();
  delegate->ancestor = newSession(ancestorConnection);
  configureAndStart(true);
  send();
  EXPECT_THAT(connection->received(), IsEmpty());
  ASSERT_EQ(ancestorConnection->received().size(), 2U);
  EXPECT_EQ(ancestorConnection->received().back().messageInfo, info());
  EXPECT_EQ(ancestorConnection->received().back().payload->size(), 3U);
  delegate->ancestor.reset();
}

TEST_F(SessionDispatch, TopLevelSessionAsksWithoutTheLock) {
  offer({"httppost"});
  configureAndStart();
  const int locks = delegate->locksTaken;
  const int lookups = delegate->ancestorLookups;
  send();
  EXPECT_EQ(delegate->locksTaken, locks);
  EXPECT_EQ(delegate->ancestorLookups, lookups + 1);
}

TEST_F(SessionDispatch, DeeperSessionAsksUnderTheLock) {
  offer({"httppost"});
  backends.scripts["httppost"].hierarchy = 1;
  configureAndStart();
  const int locks = delegate->locksTaken;
  send();
  EXPECT_EQ(delegate->locksTaken, locks + 1);
}

TEST_F(SessionDispatch, WithoutAggregatorNothingIsSentToTheClient) {
  offer({"httppost"});
  configureAndStart();
  send();
  EXPECT_THAT(connection->received(), IsEmpty());
}

TEST_F(SessionDispatch, AProxyThatCannotBeHadIsLogged) {
  connection->failProxies(Error("IPC", 5, "gone"));
  session->sendToAggregator(std::nullopt, 0, 0, 0, std::nullopt);
  EXPECT_TRUE(
      logged(LogLevel::error, "sendMessageWithDictionary: Failed to get remote object proxy: IPC (5): gone"));
}

TEST_F(SessionDispatch, ShutdownSignalsTheClientOnceAndForgetsTheAggregator) {
  session->setSessionInfo(info(), user(), std::nullopt, true);
  session->shutdownSessionAggregation();
  session->shutdownSessionAggregation();
  EXPECT_EQ(world.log.count(LogLevel::debug,
                            "shutdownSessionAggregation: Disable aggregation module for session 7"),
            2U);
  EXPECT_FALSE(session->hasAggregator());
  ASSERT_EQ(connection->received().size(), 1U);
  const auto signal = connection->received().at(0);
  EXPECT_FALSE(signal.messageInfo);
  EXPECT_EQ(signal.timestamp, 0.0);
  EXPECT_EQ(signal.category, 0);
  EXPECT_EQ(signal.type, 0);
  EXPECT_FALSE(signal.payload);
}

// Flush.

class SessionFlush : public SessionDispatch {
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
  backends.last("httppost")->heldFlushes.at(0)(std::nullopt, error);
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.error, error);
  backends.last("dashboard")->heldFlushes.at(0)(std::nullopt, Error("other", 1, "late"));
  backends.last("vesmer")->heldFlushes.at(0)("late", std::nullopt);
  EXPECT_EQ(answer.calls, 1);
  EXPECT_EQ(answer.error, error);
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

TEST_F(SessionFlush, AllSessionsShareOneLock) {
  EXPECT_EQ(&TarneldSession::classLock(), &TarneldSession::classLock());
  offer({"httppost"});
  configureAndStart();
  // The completion runs under the lock; taking it again on the same thread must not hang.
  bool ran = false;
  session->flushMessagesWithCompletion([&ran](MaybeString /*text*/, MaybeError /*error*/) {
    const LockGuard guard(TarneldSession::classLock());
    ran = true;
  });
  EXPECT_TRUE(ran);
}

}  // namespace
}  // namespace tarnel::fake
