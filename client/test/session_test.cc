#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <string>
#include <vector>

#include "client/test/session_test_fixture.h"
#include "tarnel/tarnel.h"

// What each call carries to the daemon, and what comes back.

namespace tarnel::client {
namespace {

using ::testing::ElementsAre;

TEST_F(SessionTest, PassesSessionInfoUserInfoAndFrameworks) {
  Session session(options());
  ASSERT_TRUE(session.status().ok()) << session.status().message;
  const auto info =
      Dictionary().set(kTarnelSessionInfoSessionID, 42U).set(kTarnelSessionInfoBatchEvent, true);
  const auto user = Dictionary().set(kTarnelUserInfoClientName, "camera");
  const auto frameworks = Array().append("media").append(std::string("calls"));
  ASSERT_TRUE(session.setSessionInfo(info, user, frameworks));

  const auto calls = daemon_.waitFor(1);
  EXPECT_EQ(calls[0].member, "SetSessionInfo");
  EXPECT_FALSE(calls[0].wantsReply);
  EXPECT_EQ(calls[0].sessionInfo, (tarnel::Dictionary{{"sessionID", 42}, {"batchEvent", true}}));
  EXPECT_EQ(calls[0].userInfo, (tarnel::Dictionary{{"clientName", "camera"}}));
  EXPECT_EQ(calls[0].array, (tarnel::Array{"media", "calls"}));
  EXPECT_FALSE(calls[0].hasAggregation);
}

TEST_F(SessionTest, PassesAbsentArgumentsAsAbsent) {
  Session session(options());
  ASSERT_TRUE(session.setSessionInfo({}));
  ASSERT_TRUE(session.sendMessage(1, 2));
  const auto calls = daemon_.waitFor(2);
  EXPECT_EQ(calls[0].sessionInfo, std::nullopt);
  EXPECT_EQ(calls[0].userInfo, std::nullopt);
  EXPECT_EQ(calls[0].array, std::nullopt);
  EXPECT_EQ(calls[1].payload, std::nullopt);
  EXPECT_FALSE(calls[1].wantsReply);
}

TEST_F(SessionTest, GivesTheNamesOfTheLiveBackendsOrNone) {
  Session session(options());
  const auto configured = session.startConfigAndWait(kLong);
  ASSERT_TRUE(configured.ok()) << configured.status.message;
  ASSERT_TRUE(configured.names);
  EXPECT_THAT(*configured.names, ElementsAre("httppost", "dravik"));

  const auto states = session.fetchStatesAndWait(Dictionary().set("serviceName", "video"), kLong);
  ASSERT_TRUE(states.ok());
  EXPECT_EQ(states.names, std::nullopt);
  EXPECT_EQ(daemon_.received().at(1).userInfo, (tarnel::Dictionary{{"serviceName", "video"}}));
}

TEST_F(SessionTest, GivesTheDisplayURL) {
  Session session(options());
  EXPECT_EQ(session.fetchDisplayURLAndWait(kLong).text, "URL not available");
}

TEST_F(SessionTest, GivesTextErrorOrNothingForAMessage) {
  Session session(options());
  const auto text = session.sendMessageAndWait(7, 3, Dictionary().set("a", 1), Flag::normal, kLong);
  ASSERT_TRUE(text.ok()) << text.status.message;
  EXPECT_EQ(text.text, "sent 7/3");
  EXPECT_FALSE(text.error);

  const auto error = session.sendMessageAndWait(7, 13, {}, Flag::normal, kLong);
  ASSERT_TRUE(error.ok());
  ASSERT_TRUE(error.error);
  EXPECT_EQ(error.error->domain, kTarnelErrorDomain);
  EXPECT_EQ(error.error->code, 503);
  EXPECT_EQ(error.error->description, "switched off");

  const auto nothing = session.sendMessageAndWait(7, 14, {}, Flag::normal, kLong);
  EXPECT_TRUE(nothing.ok());
  EXPECT_FALSE(nothing.text);
  EXPECT_FALSE(nothing.error);
  EXPECT_EQ(daemon_.received().at(0).member, "SendMessage");
}

TEST_F(SessionTest, AMessageWithAFlagCarriesIt) {
  Session session(options());
  const auto reply =
      session.sendMessageAndWait(1, 2, Dictionary().set("k", "v"), Flag::realtimeAndImportant, kLong);
  EXPECT_EQ(reply.text, "sent 1/2");
  const auto call = daemon_.received().at(0);
  EXPECT_EQ(call.flag, 3U);
  EXPECT_EQ(call.payload, (tarnel::Dictionary{{"k", "v"}}));
}

TEST_F(SessionTest, SendsAMessageGivenAsOneDictionaryAsItStands) {
  Session session(options());
  const auto message = Dictionary().set(kTarnelMessageParametersType, 5);
  EXPECT_TRUE(session.sendMessageDictionaryAndWait(message, kLong).ok());
  EXPECT_EQ(daemon_.received().at(0).member, "SendMessageDictionary");
  EXPECT_EQ(daemon_.received().at(0).payload, (tarnel::Dictionary{{"type", 5}}));
}

TEST_F(SessionTest, FlushGivesTextAndError) {
  Session session(options());
  const auto flushed = session.flushAndWait(kLong);
  EXPECT_EQ(flushed.text, "flushed");
  ASSERT_TRUE(flushed.error);
  EXPECT_EQ(flushed.error->code, -1);
}

TEST_F(SessionTest, FinishesUploadsAndSendsSingleMessages) {
  Session session(options());
  EXPECT_TRUE(session.finishAndWait(kLong).ok());
  const auto uploaded = session.uploadLogDataAndWait(Array().append(Dictionary().set("line", 1)), kLong);
  EXPECT_TRUE(uploaded.success);
  EXPECT_FALSE(uploaded.error);
  const auto single = session.sendSingleMessageAndWait(Dictionary().set("sessionID", 9), {}, 2, 4,
                                                       Dictionary().set("x", 2.5), kLong);
  EXPECT_EQ(single.text, "finished");

  const auto calls = daemon_.waitFor(3);
  EXPECT_EQ(calls[1].array, (tarnel::Array{tarnel::Dictionary{{"line", 1}}}));
  EXPECT_EQ(calls[2].sessionInfo, (tarnel::Dictionary{{"sessionID", 9}}));
  EXPECT_EQ(calls[2].userInfo, std::nullopt);
  EXPECT_EQ(calls[2].category, 2);
  EXPECT_EQ(calls[2].type, 4);
  EXPECT_EQ(calls[2].payload, (tarnel::Dictionary{{"x", 2.5}}));
}

TEST_F(SessionTest, EveryTypeOfValueArrives) {
  Session session(options());
  auto payload = Dictionary()
                     .set("b", true)
                     .set("i", -5)
                     .set("u", UINT64_MAX)
                     .set("d", 0.25)
                     .set("t", Date{1.5})
                     .set("s", "Grüße")
                     .set("y", std::vector<std::uint8_t>{0, 255})
                     .set("e", std::vector<std::uint8_t>())
                     .set("a", Array().append(1).append(false))
                     .set("n", Dictionary().set("in", "side"));
  ASSERT_TRUE(session.sendMessage(1, 1, payload));
  const tarnel::Dictionary expected{{"b", true},
                                    {"i", -5},
                                    {"u", UINT64_MAX},
                                    {"d", 0.25},
                                    {"t", tarnel::Date{1.5}},
                                    {"s", "Grüße"},
                                    {"y", tarnel::Data{0, 255}},
                                    {"e", tarnel::Data{}},
                                    {"a", tarnel::Array{1, false}},
                                    {"n", tarnel::Dictionary{{"in", "side"}}}};
  EXPECT_EQ(daemon_.waitFor(1)[0].payload, expected);
}

}  // namespace
}  // namespace tarnel::client
