#include "backends/https/https_post_backend_fixture.h"

namespace tarnel {
namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

constexpr RespCode kStop{1};

class HTTPSPostBackendSendTest : public HTTPSPostBackendFixture {
 protected:
  static const std::string& textOf(const MaybeSentObject& sent) { return std::get<std::string>(*sent); }
  size_t posts() const { return world.http.requests().size(); }
  void expectNothingToFlush(TarnelBackend& backend) {
    const auto [text, error] = flush(backend);
    EXPECT_EQ(text, std::nullopt);
    EXPECT_EQ(error, Error(kTarnelErrorDomain, -1, "Nothing to flush"));
  }
};

TEST_F(HTTPSPostBackendSendTest, DisabledBackendDropsMessages) {
  const auto backend = makeUpdated();
  backend->setState(ReportingState::disabled);
  EXPECT_EQ(send(*backend, 3, Flag{3}), std::nullopt);
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(sendMessage)").empty());
  backend->setState(ReportingState::enabled);
  expectNothingToFlush(*backend);
  EXPECT_EQ(posts(), 0U);
}

TEST_F(HTTPSPostBackendSendTest, DroppedMessagesStillCount) {
  const auto backend = makeUpdated();
  backend->setState(ReportingState::disabled);
  send(*backend);
  backend->setState(ReportingState::enabled);
  send(*backend);
  flush(*backend);
  EXPECT_EQ(*postedEvents()[0].find("_eventNumber"), Value(2));
}

// --- session stop ---

TEST_F(HTTPSPostBackendSendTest, StopMessageTellsConsentSamplingAndBatching) {
  entry.set("override_dnu", 1);
  entry.set("sampling_threshold", 0);
  entry.set("override_sampling", 0.75);
  const auto backend = makeUpdated();
  ASSERT_EQ(backend->state(), ReportingState::sampledOut);
  const Dictionary payload{{"StorebagVersion", "7"}};
  send(*backend, 0, Flag{3}, payload, 1);
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP "
            "message dictionary");
  const auto event = postedEvents().at(0);
  EXPECT_EQ(*event.find("StorebagVersion"), Value("7"));
  EXPECT_EQ(*event.find("Opt"), Value(2));
  EXPECT_EQ(*event.find("SamplingThreshold"), Value(0));
  EXPECT_EQ(*event.find("OverrideSampling"), Value(0.75));
  EXPECT_EQ(*event.find("Batch"), Value(1));
  EXPECT_EQ(payload.size(), 1U);
}

TEST_F(HTTPSPostBackendSendTest, StopMessageSaysMinusOneForWhatIsAbsent) {
  requireUserInfo = false;
  batch = false;
  const auto backend = makeUpdated();
  send(*backend, 0, Flag::normal, Dictionary(), 1);
  const auto text = bodyText(world.http.requests().at(0));
  EXPECT_THAT(text, HasSubstr(R"("Opt":0,"SamplingThreshold":-1,"OverrideSampling":-1,"Batch":0)"));
}

TEST_F(HTTPSPostBackendSendTest, ConsentTypeInTheStopMessage) {
  entry.set("override_dnu", 1);
  world.consent.allowed = false;
  const auto backend = makeUpdated();
  send(*backend, 0, Flag::realtime, Dictionary(), 1);
  EXPECT_EQ(*postedEvents().at(0).find("Opt"), Value(1));
}

TEST_F(HTTPSPostBackendSendTest, EveryMethodStopsWithStatusOneAndNoOther) {
  const auto backend = makeUpdated();
  send(*backend, 9, Flag::realtime, Dictionary(), 1);
  send(*backend, 9, Flag::realtime, Dictionary(), 2);
  EXPECT_TRUE(postedEvents().at(0).contains("Opt"));
  EXPECT_FALSE(postedEvents().at(1).contains("Opt"));
}

TEST_F(HTTPSPostBackendSendTest, StopMessageWithoutPayloadStillMakesAnEvent) {
  const auto backend = makeUpdated();
  backend->sendMessage(std::nullopt, TimeValue{1700000060, 0}, Method{0}, kStop, Flag::realtime);
  expectLog(LogLevel::error, "HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil");
  const auto event = postedEvents().at(0);
  EXPECT_EQ(*event.find("_status"), Value(1));
  EXPECT_FALSE(event.contains("Opt"));
}

// --- at once or batched ---

TEST_F(HTTPSPostBackendSendTest, NormalMessagesAreBatched) {
  const auto backend = makeUpdated();
  EXPECT_EQ(send(*backend), std::nullopt);
  EXPECT_EQ(posts(), 0U);
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): realtime is 0");
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): Batching 2, 1, 1");
}

TEST_F(HTTPSPostBackendSendTest, WithoutBatchingEveryMessageIsPosted) {
  batch = false;
  const auto backend = makeUpdated();
  const auto sent = send(*backend, 3, Flag::normal, Dictionary{{"a", 1}}, 8);
  ASSERT_EQ(posts(), 1U);
  const auto request = world.http.requests()[0];
  EXPECT_EQ(request.url, "https://events.example/post");
  EXPECT_EQ(*headerOf(request, "X-TRN-Event-Map"), "3 8");
  EXPECT_EQ(parsed(textOf(sent)), parsed(bodyText(request)));
  EXPECT_THAT(textOf(sent), HasSubstr("\n"));
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): realtime is 0");
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): Sending 2, 0, 1");
}

TEST_F(HTTPSPostBackendSendTest, FlagsOfRealtimeArePostedAtOnceToTheRealtimeAddress) {
  const auto backend = makeUpdated();
  for (const int flag : {1, 3}) send(*backend, 3, Flag{flag});
  ASSERT_EQ(posts(), 2U);
  EXPECT_EQ(world.http.requests()[0].url, "https://events.example/realtime");
  EXPECT_EQ(world.http.requests()[1].url, "https://events.example/realtime");
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): realtime is 1");
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): Sending 2, 1, 1");
  for (const int flag : {0, 2, 4, 5, -1}) send(*backend, 3, Flag{flag});
  EXPECT_EQ(posts(), 2U);
}

TEST_F(HTTPSPostBackendSendTest, RealtimeMessageFlushesTheBatchFirst) {
  const auto backend = makeUpdated();
  for (int i = 0; i < 3; ++i) send(*backend);
  const auto sent = send(*backend, 5, Flag::realtime);
  expectLog(LogLevel::debug,
            "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. "
            "Forcing Flush here to keep events in order.");
  const auto all = messages();
  ASSERT_EQ(all.size(), 2U);
  EXPECT_EQ(eventsOf(all[0]).size(), 3U);
  EXPECT_EQ(eventsOf(all[1]).size(), 1U);
  EXPECT_EQ(world.http.requests()[0].url, "https://events.example/post");
  EXPECT_EQ(headerOf(world.http.requests()[0], "X-TRN-Event-Map"), nullptr);
  EXPECT_EQ(world.http.requests()[1].url, "https://events.example/realtime");
  const auto& text = textOf(sent);
  ASSERT_THAT(text, StartsWith("Flushed events:\n{"));
  const auto second = text.find("\nStandalone event:\n");
  ASSERT_NE(second, std::string::npos);
  EXPECT_EQ(parsed(text.substr(16, second - 16)), all[0]);
  EXPECT_EQ(parsed(text.substr(second + 19)), all[1]);
}

TEST_F(HTTPSPostBackendSendTest, WithoutPrettyCopiesTheFlushedTextsAreNull) {
  entry.set("override_dnu", 1);
  const auto backend = makeUpdated();
  EXPECT_EQ(send(*backend, 3, Flag::realtime), std::nullopt);
  send(*backend);
  EXPECT_EQ(textOf(send(*backend, 3, Flag::realtime)), "Flushed events:\n(null)\nStandalone event:\n(null)");
  EXPECT_EQ(posts(), 3U);
}

TEST_F(HTTPSPostBackendSendTest, UnbatchedNormalMessageDoesNotFlushABatch) {
  const auto backend = makeUpdated();
  send(*backend);
  backend->setBatchEvents(false);
  const auto sent = send(*backend);
  EXPECT_THAT(textOf(sent), StartsWith("{"));
  EXPECT_EQ(posts(), 1U);
  EXPECT_EQ(flush(*backend).second, std::nullopt);
  EXPECT_EQ(posts(), 2U);
}

TEST_F(HTTPSPostBackendSendTest, WithoutRequiredUserInfoEverythingIsBatched) {
  userInfo.reset();
  const auto backend = makeUpdated();
  backend->setState(ReportingState::enabled);
  send(*backend, 3, Flag{3});
  EXPECT_EQ(posts(), 0U);
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): Batching 2, 1, 1");
  const auto [text, error] = flush(*backend);
  EXPECT_EQ(text, std::nullopt);
  EXPECT_EQ(error, Error(kTarnelErrorDomain, -1, "Can not flush: userInfo is required"));
  // The batch is kept.
  backend->setUserInfoDict(Dictionary{{"u", 1}});
  backend->setPostURL("https://events.example/post");
  EXPECT_EQ(flush(*backend).second, std::nullopt);
  EXPECT_EQ(postedEvents().size(), 1U);
}

TEST_F(HTTPSPostBackendSendTest, UserInfoThatIsNotRequiredDoesNotHoldMessages) {
  requireUserInfo = false;
  userInfo.reset();
  const auto backend = makeUpdated();
  send(*backend, 3, Flag::realtime);
  EXPECT_EQ(posts(), 1U);
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): Sending 2, 1, 0");
}

TEST_F(HTTPSPostBackendSendTest, UndecidedAndSampledOutBackendsHoldMessages) {
  batch = false;
  for (const auto state : {ReportingState::undecided, ReportingState::sampledOut}) {
    const auto backend = makeUpdated();
    backend->setState(state);
    send(*backend);
    send(*backend, 3, Flag::realtime);
    EXPECT_EQ(backend->state(), state);
    EXPECT_EQ(posts(), 0U);
  }
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): Batching 0, 0, 1");
  expectLog(LogLevel::debug, "HTTPSPostBackend(sendMessage): Batching 3, 0, 1");
}

// --- promotion ---

TEST_F(HTTPSPostBackendSendTest, ImportantMessagePromotesASampledOutBackend) {
  const auto backend = makeUpdated();
  backend->setState(ReportingState::sampledOut);
  send(*backend);
  send(*backend, 3, Flag::important);
  EXPECT_EQ(backend->state(), ReportingState::enabled);
  EXPECT_EQ(posts(), 0U);
  flush(*backend);
  EXPECT_EQ(postedEvents().size(), 2U);
}

TEST_F(HTTPSPostBackendSendTest, ImportantRealtimeMessageReleasesTheHeldEventsAtOnce) {
  const auto backend = makeUpdated();
  backend->setState(ReportingState::sampledOut);
  send(*backend);
  EXPECT_THAT(textOf(send(*backend, 3, Flag{3})), StartsWith("Flushed events:\n{"));
  EXPECT_EQ(postedEvents().size(), 2U);
}

TEST_F(HTTPSPostBackendSendTest, OnlyImportantMessagesPromoteAndOnlyTheSampledOut) {
  const auto backend = makeUpdated();
  backend->setState(ReportingState::sampledOut);
  send(*backend, 3, Flag::realtime);
  EXPECT_EQ(backend->state(), ReportingState::sampledOut);
  backend->setState(ReportingState::undecided);
  send(*backend, 3, Flag::important);
  EXPECT_EQ(backend->state(), ReportingState::undecided);
}

TEST_F(HTTPSPostBackendSendTest, UpdateEndsAPromotion) {
  entry.set("sampling_threshold", 0);
  const auto backend = makeUpdated();
  send(*backend, 3, Flag::important);
  EXPECT_EQ(backend->state(), ReportingState::enabled);
  backend->updateState();
  EXPECT_EQ(backend->state(), ReportingState::sampledOut);
}

// --- flush ---

TEST_F(HTTPSPostBackendSendTest, FlushPostsTheBatchInOrderAndTellsItsText) {
  const auto backend = makeUpdated();
  for (int i = 0; i < 3; ++i) send(*backend, i);
  MaybeString told;
  const auto text = backend->flushMessagesWithCompletion([&told](MaybeString flushed, MaybeError error) {
    told = std::move(flushed);
    EXPECT_EQ(error, std::nullopt);
  });
  expectLog(LogLevel::debug, "HTTPSPostBackend(flushMessagesWithCompletion): called");
  ASSERT_TRUE(text);
  EXPECT_EQ(told, text);
  ASSERT_EQ(posts(), 1U);
  EXPECT_EQ(parsed(*text), messages()[0]);
  EXPECT_EQ(world.http.requests()[0].url, "https://events.example/post");
  EXPECT_EQ(headerOf(world.http.requests()[0], "X-TRN-Event-Map"), nullptr);
  const auto events = postedEvents();
  for (size_t i = 0; i < 3; ++i) EXPECT_EQ(*events[i].find("_method"), Value(i));
  expectNothingToFlush(*backend);
}

TEST_F(HTTPSPostBackendSendTest, FlushCompletesWhenThePostIsAnswered) {
  world.http.holdAnswers(true);
  const auto backend = makeUpdated();
  send(*backend);
  std::optional<std::pair<MaybeString, MaybeError>> told;
  const auto text = backend->flushMessagesWithCompletion([&told](MaybeString flushed, MaybeError error) {
    told = {std::move(flushed), std::move(error)};
  });
  EXPECT_FALSE(told);
  expectNothingToFlush(*backend);
  world.http.answerOldest(fake::FakeHttpClient::status(503));
  ASSERT_TRUE(told);
  EXPECT_EQ(told->first, text);
  EXPECT_EQ(told->second,
            Error(kTarnelErrorDomain, 503, "backend httppost disabled by server 503 return code"));
  EXPECT_EQ(backend->state(), ReportingState::disabled);
}

TEST_F(HTTPSPostBackendSendTest, FlushWithoutAnAddressTellsTheTextAndTheError) {
  entry.remove("post_url");
  const auto backend = makeUpdated();
  send(*backend);
  const auto [text, error] = flush(*backend);
  EXPECT_TRUE(text);
  EXPECT_EQ(error, Error(kTarnelErrorDomain, -1, "postURL is nil"));
}

TEST_F(HTTPSPostBackendSendTest, FlushWithoutABatchHasNothingToFlush) {
  const auto backend = makeUpdated();
  expectNothingToFlush(*backend);
  EXPECT_EQ(backend->flushMessagesWithCompletion({}), std::nullopt);
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(flushMessages").empty());
}

TEST_F(HTTPSPostBackendSendTest, FlushMergesTheCurrentUserInfoFiltered) {
  entry.set("filters", Array{Dictionary{{"key", "secret"}, {"action", "remove"}},
                             Dictionary{{"key", "hashed"}, {"action", "sha256"}},
                             Dictionary{{"method", 3}, {"key", "byMethod"}, {"action", "remove"}}});
  const auto backend = makeUpdated();
  send(*backend, 3, Flag::normal, Dictionary{{"late", "payload"}, {"a", 1}});
  backend->setUserInfoDict(
      Dictionary{{"late", "user info"}, {"secret", "s"}, {"hashed", "h"}, {"byMethod", "m"}});
  flush(*backend);
  const auto event = postedEvents().at(0);
  EXPECT_EQ(*event.find("late"), Value("user info"));
  EXPECT_EQ(*event.find("a"), Value(1));
  EXPECT_FALSE(event.contains("secret"));
  EXPECT_EQ(*event.find("hashed"), Value(TarnelBackend::convertIntoSHA256("h")));
  // User information has no method of its own: it counts as 0, and a filter of method 3 passes it by.
  EXPECT_EQ(*event.find("byMethod"), Value("m"));
}

TEST_F(HTTPSPostBackendSendTest, FlushDoesNotTouchTheUserInfoItself) {
  userInfo->set("secret", "s");
  const auto backend = makeUpdated();
  send(*backend);
  flush(*backend);
  EXPECT_TRUE(backend->userInfoDict()->contains("secret"));
}

}  // namespace
}  // namespace tarnel
