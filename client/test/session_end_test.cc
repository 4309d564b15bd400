#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <future>
#include <mutex>
#include <string>
#include <vector>

#include "client/test/session_test_fixture.h"
#include "tarnel/tarnel.h"

// Errors, waiting, calls of the daemon, and the end of a session.

namespace tarnel::client {
namespace {

using namespace std::chrono_literals;
using ::testing::HasSubstr;

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
