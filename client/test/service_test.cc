#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <string>

#include "platform/linux/ipc/ipc_test_support.h"
#include "tarnel/tarnel.h"

// The library against the daemon's own IPC service.

namespace tarnel {
namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

constexpr auto kLong = 30s;

client::Options optionsFor(const Service& service) {
  client::Options options;
  options.socketPath = service.path();
  options.linger = kLong;
  return options;
}

TEST(ClientAndService, EveryCallOfTheInterfaceIsUnderstoodAndAnswered) {
  Service service;
  service.start();
  client::Session session(optionsFor(service));
  const auto info = client::Dictionary().set("sessionID", 7);
  ASSERT_TRUE(
      session.setSessionInfo(info, client::Dictionary().set("clientName", "c"), client::Array().append("f")));
  EXPECT_THAT(*session.startConfigAndWait(kLong).names, ElementsAre("httppost", "dashboard"));
  EXPECT_EQ(session.fetchStatesAndWait({}, kLong).names, std::nullopt);
  EXPECT_EQ(session.fetchDisplayURLAndWait(kLong).text, "URL not available");
  EXPECT_TRUE(session.sendMessageAndWait(1, 2, info, client::Flag::normal, kLong).text);
  EXPECT_TRUE(session.sendMessageAndWait(3, 4, info, client::Flag::important, kLong).text);
  EXPECT_TRUE(session.sendMessageDictionaryAndWait(client::Dictionary().set("category", 1), kLong).text);
  EXPECT_EQ(session.flushAndWait(kLong).error->description, "No backends available to send message");
  EXPECT_EQ(session.finishAndWait(kLong).error->code, 503);
  EXPECT_TRUE(session.uploadLogDataAndWait(client::Array().append("line"), kLong).success);
  const auto single = session.sendSingleMessageAndWait(info, {}, 5, 6, {}, kLong);
  EXPECT_TRUE(single.ok()) << single.status.message;
  EXPECT_EQ(single.text, std::nullopt);
  EXPECT_EQ(service.session()->count(), 11U);
}

TEST(ClientAndService, AThousandMessagesArriveInOrderWithAndWithoutAnswers) {
  Service service;
  service.start();
  {
    client::Session session(optionsFor(service));
    std::atomic<int> answered{0};
    for (uint16_t i = 0; i < 1000; ++i) {
      client::Completion completion;
      if (i % 2 == 0)
        completion = [&answered](const client::Reply& reply) { answered += reply.ok() ? 1 : 0; };
      ASSERT_TRUE(session.sendMessage(1, i, {}, client::Flag::normal, completion));
    }
    ASSERT_TRUE(session.drain(kLong));
    EXPECT_EQ(answered, 500);
    const auto calls = service.session()->calls();
    ASSERT_EQ(calls.size(), 1000U);
    for (size_t i = 0; i < 1000; ++i) EXPECT_THAT(calls[i], HasSubstr("1 " + std::to_string(i) + " none"));
  }
}

TEST(ClientAndService, AReplyThatNeverComesIsTold) {
  Service service;
  service.prepare = [](RecordingSession& session) {
    session.answerSend = [](const SentReply&) {};  // lets go of it
  };
  service.start();
  client::Session session(optionsFor(service));
  const auto reply = session.sendMessageAndWait(1, 1, {}, client::Flag::normal, kLong);
  EXPECT_EQ(reply.status.code, TARNEL_ERROR_NO_REPLY) << reply.status.message;
}

TEST(ClientAndService, AClientWithoutTheEntitlementIsToldSo) {
  Service service;
  service.entitlements().grants = false;
  service.start();
  client::Session session(optionsFor(service));
  const auto configured = session.startConfigAndWait(kLong);
  EXPECT_EQ(configured.status.code, TARNEL_ERROR_REFUSED);
  EXPECT_THAT(configured.status.message, HasSubstr("lacks the entitlement com.orvane.private.tarneld"));
}

TEST(ClientAndService, AggregationReachesTheClient) {
  Service service;
  service.start();
  std::promise<std::pair<int64_t, std::string>> seen;
  std::promise<void> ended;
  auto options = optionsFor(service);
  options.onAggregatedMessage = [&seen](client::DictionaryView info, double, uint16_t, uint16_t,
                                        client::DictionaryView payload) {
    seen.set_value({info.find("sessionID").toInt64(), std::string(payload.find("k").toString())});
  };
  options.onAggregationEnd = [&ended] { ended.set_value(); };
  client::Session session(std::move(options));
  ASSERT_TRUE(session.startConfigAndWait(kLong).ok());
  const auto proxy = service.connection(0)->remoteObjectProxyWithErrorHandler([](const Error&) {});
  ASSERT_NE(proxy, nullptr);
  proxy->sendMessageToClient(Dictionary{{"sessionID", 4}}, 1.5, 2, 3, Dictionary{{"k", "v"}});
  proxy->sendMessageToClient(std::nullopt, 0.0, 0, 0, std::nullopt);
  EXPECT_EQ(seen.get_future().get(), std::make_pair(int64_t{4}, std::string("v")));
  ended.get_future().wait();
}

TEST(ClientAndService, TheLargestCallThatTheLibraryAcceptsIsAccepted) {
  Service service;
  service.start();
  client::Session session(optionsFor(service));
  size_t length = (1U << 20U) - 200;
  client::Reply reply;
  do {
    --length;
    reply = session.sendMessageAndWait(1, 1, client::Dictionary().set("s", std::string(length, 'x')),
                                       client::Flag::normal, kLong);
  } while (reply.status.code == TARNEL_ERROR_TOO_LARGE);
  EXPECT_TRUE(reply.ok()) << reply.status.message;
}

TEST(ClientAndService, TheServiceGoingAwayIsAnInterruption) {
  auto service = std::make_unique<Service>();
  service->start();
  std::promise<client::Disconnection> told;
  auto options = optionsFor(*service);
  options.onInterruption = [&told](const client::Disconnection& d) { told.set_value(d); };
  client::Session session(std::move(options));
  ASSERT_TRUE(session.startConfigAndWait(kLong).ok());
  service.reset();
  EXPECT_EQ(told.get_future().get().why.code, TARNEL_ERROR_INTERRUPTED);
}

}  // namespace
}  // namespace tarnel
