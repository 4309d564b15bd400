#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <future>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "client/test/test_daemon.h"
#include "platform/ipc/wire.h"
#include "tarnel/tarnel.h"

// The C++ interface, and under it the C interface and everything else, against a stand-in daemon.

namespace tarnel::client {
namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

constexpr auto kLong = 30s;

class SessionTest : public ::testing::Test {
 protected:
  Options options() const {
    Options options;
    options.socketPath = folder_.file("socket");
    return options;
  }

  // From when this returns: the stand-in's thread has gone round once, and sees the flag before it waits
  // again.
  void stopAccepting() {
    daemon_.stopsAccepting = true;
    daemon_.callClients({}, 0, 0, 0, {});
  }

  test::ScratchFolder folder_;
  test::TestDaemon daemon_{folder_.file("socket")};
};

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

  const auto notText = session.sendMessage(1, 1, Dictionary().set("bad", "\xC3("));
  EXPECT_EQ(notText.code, TARNEL_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(notText.message, "this cannot be sent: at key \"bad\": the text is not UTF-8");

  const auto reply = session.sendMessageAndWait(1, 1, Dictionary().set("s", "\xFF"), Flag::normal, kLong);
  EXPECT_EQ(reply.status.code, TARNEL_ERROR_INVALID_ARGUMENT);

  EXPECT_TRUE(session.drain(kLong));
  EXPECT_TRUE(daemon_.received().empty());
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

TEST_F(SessionTest, ErrorsOfTheDaemonAreTold) {
  Session session(options());
  daemon_.refuses = true;
  const auto refused = session.flushAndWait(kLong);
  EXPECT_EQ(refused.status.code, TARNEL_ERROR_DAEMON);
  EXPECT_EQ(refused.status.message, "the daemon did not accept the call: because of the test");
  daemon_.saysNoReply = true;
  EXPECT_EQ(session.flushAndWait(kLong).status.code, TARNEL_ERROR_NO_REPLY);
  daemon_.refuses = false;
  daemon_.saysNoReply = false;
  daemon_.answersNonsense = true;
  const auto nonsense = session.flushAndWait(kLong);
  EXPECT_EQ(nonsense.status.code, TARNEL_ERROR_PROTOCOL);
  EXPECT_THAT(nonsense.status.message, HasSubstr("signature \"s\" and not \"asa(sxs)\""));
}

TEST_F(SessionTest, WaitsAndAnswersEnd) {
  daemon_.isSilent = true;
  auto impatient = options();
  impatient.replyTimeout = 20ms;
  Session session(std::move(impatient));
  std::promise<Reply> answer;
  ASSERT_TRUE(session.flush([&answer](const Reply& reply) { answer.set_value(reply); }));
  EXPECT_EQ(answer.get_future().get().status.code, TARNEL_ERROR_TIMED_OUT);

  auto patient = options();
  patient.linger = 0ms;
  Session other(std::move(patient));
  const auto waited = other.flushAndWait(20ms);
  EXPECT_EQ(waited.status.code, TARNEL_ERROR_TIMED_OUT);
  EXPECT_EQ(waited.status.message, "no answer within 20 ms; the call is still under way");
  EXPECT_EQ(other.flushAndWait(0ms).status.code, TARNEL_ERROR_INVALID_ARGUMENT);
}

TEST_F(SessionTest, ACallbackCallsButCannotWait) {
  Session session(options());
  std::promise<std::pair<Reply, Status>> seen;
  ASSERT_TRUE(session.startConfig([&session, &seen](const Reply&) {
    const auto waited = session.flushAndWait(kLong);
    seen.set_value({waited, session.sendMessage(3, 3)});
  }));
  const auto [waited, sent] = seen.get_future().get();
  EXPECT_EQ(waited.status.code, TARNEL_ERROR_WRONG_THREAD);
  EXPECT_TRUE(sent);
  EXPECT_EQ(daemon_.waitFor(2)[1].category, 3);
}

// Whatever the daemon asks for, only a file that waits for its answer is deleted.
TEST_F(SessionTest, OnlyAFileThatWasHandedOverAndNotAnsweredForIsDeleted) {
  const std::string file = folder_.file("file");
  const std::string other = folder_.file("other");
  std::ofstream(file) << "x";
  std::ofstream(other) << "x";
  std::mutex mutex;
  std::condition_variable came;
  int calls = 0;
  auto aggregating = options();
  aggregating.onAggregatedMessage = [&](DictionaryView, double, uint16_t, uint16_t, DictionaryView) {
    const std::lock_guard lock(mutex);
    ++calls;
    came.notify_all();
  };
  // Returns when the client has done what it was asked.
  auto ask = [&, this, asked = 0](const std::string& path) mutable {
    daemon_.askToDelete("file://" + path);
    daemon_.callClients(std::nullopt, 1.0, 0, 0, std::nullopt);
    ++asked;
    std::unique_lock lock(mutex);
    EXPECT_TRUE(came.wait_for(lock, kLong, [&calls, asked] { return calls == asked; }));
  };
  Session session(std::move(aggregating));
  EXPECT_TRUE(session.uploadFileAndWait(file, kLong).success);
  ask(file);
  EXPECT_TRUE(std::filesystem::exists(file));
  daemon_.isSilent = true;
  EXPECT_TRUE(session.uploadFile(file));
  daemon_.waitFor(2);
  ask(other);
  EXPECT_TRUE(std::filesystem::exists(file));
  EXPECT_TRUE(std::filesystem::exists(other));
  ask(file);
  EXPECT_FALSE(std::filesystem::exists(file));
  EXPECT_TRUE(std::filesystem::exists(other));
}

TEST_F(SessionTest, AggregatedMessagesAndTheirEndReachTheHandlers) {
  struct Message {
    bool hasInfo;
    int64_t sessionID;
    double timestamp;
    int category;
    int type;
    bool hasPayload;
    std::string text;
  };
  std::vector<Message> messages;
  std::promise<void> ended;
  auto aggregating = options();
  aggregating.onAggregatedMessage = [&messages](DictionaryView info, double timestamp, uint16_t category,
                                                uint16_t type, DictionaryView payload) {
    messages.push_back({bool(info), info.find("sessionID").toInt64(), timestamp, category, type,
                        bool(payload), std::string(payload.find("k").toString())});
  };
  aggregating.onAggregationEnd = [&ended] { ended.set_value(); };
  Session session(std::move(aggregating));
  ASSERT_TRUE(session.setSessionInfo(Dictionary().set("sessionID", 1)));
  EXPECT_TRUE(daemon_.waitFor(1)[0].hasAggregation);

  daemon_.callClients(tarnel::Dictionary{{"sessionID", 5}}, 12.5, 3, 4, tarnel::Dictionary{{"k", "v"}});
  daemon_.callClients(std::nullopt, 1.0, 0, 0, std::nullopt);  // a time: not the end
  daemon_.callClients(std::nullopt, 0.0, 0, 0, std::nullopt);
  ended.get_future().wait();
  ASSERT_EQ(messages.size(), 2U);
  EXPECT_EQ(messages[0].sessionID, 5);
  EXPECT_EQ(messages[0].timestamp, 12.5);
  EXPECT_EQ(messages[0].category, 3);
  EXPECT_EQ(messages[0].type, 4);
  EXPECT_EQ(messages[0].text, "v");
  EXPECT_FALSE(messages[1].hasInfo);
  EXPECT_FALSE(messages[1].hasPayload);
}

TEST_F(SessionTest, WhatWasAcceptedIsStillSentWhenTheSessionGoes) {
  {
    auto patient = options();
    patient.linger = kLong;
    Session session(std::move(patient));
    for (uint16_t i = 0; i < 1000; ++i) ASSERT_TRUE(session.sendMessage(1, i));
  }
  EXPECT_EQ(daemon_.received().size(), 1000U);
}

TEST_F(SessionTest, DrainWaitsForCallsWithoutAnswersToo) {
  Session session(options());
  for (uint16_t i = 0; i < 100; ++i) ASSERT_TRUE(session.sendMessage(1, i));
  ASSERT_TRUE(session.drain(kLong));
  EXPECT_EQ(daemon_.received().size(), 100U);
}

TEST_F(SessionTest, ASessionMayBeDestroyedByItsOwnCallback) {
  std::promise<void> answered;
  std::promise<tarnel_status> rest;
  stopAccepting();
  auto session = std::make_unique<Session>(options());
  ASSERT_TRUE(session->startConfig([&session, &answered](const Reply&) {
    session.reset();
    answered.set_value();
  }));
  auto more = session->flush([&rest](const Reply& reply) { rest.set_value(reply.status.code); });
  ASSERT_TRUE(more);
  daemon_.stopsAccepting = false;
  daemon_.nudge();
  answered.get_future().wait();
  EXPECT_EQ(rest.get_future().get(), TARNEL_OK);  // within its linger time
}

TEST_F(SessionTest, OptionsOutOfTheirRangeAreNamed) {
  auto wrong = options();
  wrong.maxUnanswered = 0;
  Session session(std::move(wrong));
  EXPECT_EQ(session.status().code, TARNEL_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(session.status().message, "option max_unanswered is 0; it must be from 1 to 65536");
  EXPECT_EQ(session.state(), State::closed);
  EXPECT_EQ(session.sendMessage(1, 1).message, session.status().message);
  EXPECT_EQ(session.flushAndWait(kLong).status.message, session.status().message);
}

}  // namespace
}  // namespace tarnel::client
