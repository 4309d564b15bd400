#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <stdexcept>

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

TEST_F(SessionDispatch, ABackendThatThrowsKeepsTheMessageFromNoOther) {
  offer({"dravik", "httppost", "dashboard"});
  configureAndStart();
  for (const char* name : {"dravik", "httppost"}) backends.scripts[name].sendThrows = true;
  EXPECT_EQ(send(), MaybeSentObject(failure("send went wrong")));
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("dravik send 3/4", "httppost send 3/4", "dashboard send 3/4"));
  EXPECT_TRUE(logged(LogLevel::error, "sendMessageWithDictionary: dravik failed: send went wrong"));
  EXPECT_THAT(messageLog(),
              ElementsAre("[dravik -> sendMessageWithDictionary] TarnelErrorDomain (-1): send went wrong",
                          "[httppost -> sendMessageWithDictionary] TarnelErrorDomain (-1): send went wrong"));
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
  ASSERT_EQ(connection->sentToClient().size(), 2U);  // the start message and this one
  const auto message = connection->sentToClient().back();
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
  EXPECT_FALSE(connection->sentToClient().back().payload);
}

TEST_F(SessionDispatch, NoPayloadReachesAnAncestorsAggregatorAsNone) {
  offer({"httppost"});
  backends.scripts["httppost"].hierarchy = 1;
  const auto ancestorConnection = newConnection();
  delegate->ancestor = newSession(ancestorConnection);
  configureAndStart();
  const size_t before = ancestorConnection->sentToClient().size();
  send(std::nullopt);
  ASSERT_EQ(ancestorConnection->sentToClient().size(), before + 1);
  EXPECT_EQ(ancestorConnection->sentToClient().back().category, 3);
  EXPECT_EQ(ancestorConnection->sentToClient().back().payload, std::nullopt);
  delegate->ancestor.reset();
}

TEST_F(SessionDispatch, AClientThatCannotBeToldKeepsTheMessageFromNoBackend) {
  offer({"httppost"});
  configureAndStart(true);
  connection->whenProxyIsAsked = [] { throw std::runtime_error("no memory"); };
  send();
  EXPECT_THAT(backends.journal.lines(), ElementsAre("httppost send 3/4"));
  EXPECT_TRUE(logged(LogLevel::error, "sendToAggregator: the call of the client failed: no memory"));
  connection->whenProxyIsAsked = nullptr;
}

TEST_F(SessionDispatch, AncestorGetsTheMessageInsteadOfTheOwnClient) {
  offer({"httppost"});
  backends.scripts["httppost"].hierarchy = 1;
  const auto ancestorConnection = newConnection();
  delegate->ancestor = newSession(ancestorConnection);
  configureAndStart(true);
  send();
  EXPECT_THAT(connection->sentToClient(), IsEmpty());
  ASSERT_EQ(ancestorConnection->sentToClient().size(), 2U);
  EXPECT_EQ(ancestorConnection->sentToClient().back().messageInfo, info());
  EXPECT_EQ(ancestorConnection->sentToClient().back().payload->size(), 3U);
  delegate->ancestor.reset();
}

TEST_F(SessionDispatch, TopLevelSessionAsksWithoutTheLock) {
  offer({"httppost"});
  configureAndStart();
  const int lookups = delegate->ancestorLookups;
  send();
  EXPECT_EQ(delegate->ancestorLookups, lookups + 1);
  EXPECT_FALSE(delegate->isAncestorAskedLocked);
}

TEST_F(SessionDispatch, SessionWithoutUserInfoAsksWithoutTheLock) {
  offer({"httppost"});
  backends.scripts["httppost"].hierarchy = 1;
  session->setSessionInfo(info(), std::nullopt, std::nullopt, false);
  session->startConfigWithCompletionHandler(nullptr);
  const int lookups = delegate->ancestorLookups;
  send();
  EXPECT_EQ(delegate->ancestorLookups, lookups + 1);
  EXPECT_FALSE(delegate->isAncestorAskedLocked);
}

TEST_F(SessionDispatch, DeeperSessionAsksAndHandsOverUnderTheLock) {
  offer({"httppost"});
  backends.scripts["httppost"].hierarchy = 1;
  configureAndStart();
  const auto ancestorConnection = newConnection();
  delegate->ancestor = newSession(ancestorConnection);
  std::optional<bool> isHandedOverLocked;
  ancestorConnection->whenProxyIsAsked = [&] { isHandedOverLocked = delegate->isLocked(); };
  send();
  EXPECT_TRUE(delegate->isAncestorAskedLocked);
  EXPECT_EQ(isHandedOverLocked, true);
  EXPECT_FALSE(delegate->isLocked());
  ancestorConnection->whenProxyIsAsked = nullptr;
  delegate->ancestor.reset();
}

TEST_F(SessionDispatch, OwnClientGetsTheMessageAfterTheLockIsGivenBack) {
  offer({"httppost"});
  backends.scripts["httppost"].hierarchy = 1;
  configureAndStart(true);
  std::optional<bool> isSentLocked;
  connection->whenProxyIsAsked = [&] { isSentLocked = delegate->isLocked(); };
  send();
  EXPECT_TRUE(delegate->isAncestorAskedLocked);
  EXPECT_EQ(isSentLocked, false);
  connection->whenProxyIsAsked = nullptr;
}

TEST_F(SessionDispatch, WithoutAggregatorNothingIsSentToTheClient) {
  offer({"httppost"});
  configureAndStart();
  send();
  EXPECT_THAT(connection->sentToClient(), IsEmpty());
}

TEST_F(SessionDispatch, AProxyThatCannotBeHadIsLogged) {
  connection->proxyError = Error("IPC", 5, "gone");
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
  ASSERT_EQ(connection->sentToClient().size(), 1U);
  const auto signal = connection->sentToClient().at(0);
  EXPECT_FALSE(signal.messageInfo);
  EXPECT_EQ(signal.timestamp, 0.0);
  EXPECT_EQ(signal.category, 0);
  EXPECT_EQ(signal.type, 0);
  EXPECT_FALSE(signal.payload);
}

}  // namespace
}  // namespace tarnel::fake
