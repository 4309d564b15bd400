#include <set>

#include "backends/https/batch_poster.h"
#include "backends/https/https_post_backend_fixture.h"

// Flushes of several messages: each is made and posted when the one before is answered.

namespace tarnel {
namespace {

using fake::FakeHttpClient;

// Every event is a message of its own.
class HTTPSPostBackendPiecesTest : public HTTPSPostBackendFixture {
 protected:
  std::shared_ptr<HTTPSPostBackend> makeWithPieces(int pieces = 3) {
    const auto late = userInfo;
    userInfo.reset();
    auto backend = makeUpdated();
    for (int i = 0; i < pieces; ++i) send(*backend, i);
    userInfo = late;
    userInfo->set("large", std::string(EventBatch::kMaxBytes, 'x'));
    backend->setUserInfoDict(userInfo);
    backend->updateState();
    return backend;
  }
  MaybeString startFlush(HTTPSPostBackend& backend) {
    return backend.flushMessagesWithCompletion(
        [this](MaybeString text, MaybeError error) { told.emplace_back(std::move(text), std::move(error)); });
  }
  size_t posts() const { return world.http.requests().size(); }
  // The methods of the events that were posted, which are numbered in their order.
  void expectPosted(int events) const {
    const auto posted = postedEvents();
    ASSERT_EQ(posted.size(), static_cast<size_t>(events));
    for (int i = 0; i < events; ++i) EXPECT_EQ(*posted[static_cast<size_t>(i)].find("_method"), Value(i));
  }
  void expectLost(size_t events, const std::string& why) const {
    expectLog(LogLevel::error, "HTTPSPostBackend(flushMessagesWithCompletion): httppost: " +
                                   std::to_string(events) + " events are lost: " + why);
  }
  void expectTold(const Error& error) const {
    ASSERT_EQ(told.size(), 1U);
    EXPECT_EQ(told[0].second, error);
  }

  std::vector<std::pair<MaybeString, MaybeError>> told;
};

// Text that no compression makes much smaller.
std::string randomText(size_t length) {
  std::string text(length, ' ');
  uint32_t state = 1;
  for (char& c : text) {
    state = state * 1664525U + 1013904223U;
    c = static_cast<char>('0' + (state >> 24U) % 64U);
    if (c == '\\') c = 'x';
  }
  return text;
}

TEST_F(HTTPSPostBackendPiecesTest, NoMoreThanOneBodyIsUnderWay) {
  world.http.holdAnswers(true);
  const auto late = userInfo;
  userInfo.reset();
  const auto backend = makeUpdated();
  constexpr int kEvents = 200;
  for (int i = 0; i < kEvents; ++i) send(*backend, i);
  backend->setUserInfoDict(Dictionary{{"random", randomText(64000)}});
  backend->setState(ReportingState::enabled);
  backend->setPostURL("https://events.example/post");
  startFlush(*backend);
  size_t answered = 0;
  for (; world.http.pendingCount() > 0; ++answered) {
    EXPECT_TRUE(told.empty());
    ASSERT_EQ(world.http.pendingCount(), 1U);
    EXPECT_LE(world.http.requests().back().body->size(), EventBatch::kMaxBytes);
    world.http.answerOldest(FakeHttpClient::status(200));
  }
  EXPECT_GE(answered, 4U);
  ASSERT_EQ(told.size(), 1U);
  EXPECT_EQ(told[0].second, std::nullopt);
  expectPosted(kEvents);
}

TEST_F(HTTPSPostBackendPiecesTest, TheFlushCompletesAfterTheLastMessageWithTheFirstError) {
  world.http.holdAnswers(true);
  const auto backend = makeWithPieces(4);
  startFlush(*backend);
  const auto first = FakeHttpClient::failure("first");
  world.http.answerOldest(FakeHttpClient::status(200));
  world.http.answerOldest(first);
  world.http.answerOldest(FakeHttpClient::failure("second"));
  EXPECT_TRUE(told.empty());
  EXPECT_EQ(posts(), 4U);
  world.http.answerOldest(FakeHttpClient::status(404));
  expectTold(*first.error);
  EXPECT_EQ(world.http.pendingCount(), 0U);
  expectPosted(4);
}

TEST_F(HTTPSPostBackendPiecesTest, TheRestArrivesThoughTheBackendIsGone) {
  world.http.holdAnswers(true);
  world.dependencies.filterHeldEvents = true;
  auto backend = makeWithPieces();
  startFlush(*backend);
  const std::weak_ptr<HTTPSPostBackend> gone = backend;
  backend.reset();
  ASSERT_TRUE(gone.expired());
  while (world.http.pendingCount() > 0) world.http.answerOldest(FakeHttpClient::status(200));
  expectPosted(3);
  ASSERT_EQ(told.size(), 1U);
  EXPECT_EQ(told[0].second, std::nullopt);
  const auto requests = world.http.requests();
  for (const auto& request : requests) {
    EXPECT_EQ(request.url, requests[0].url);
    EXPECT_EQ(*headerOf(request, "X-TRN-Client-Name"), "Meetwell");
  }
}

// What the backend becomes later changes nothing in a flush that is under way.
TEST_F(HTTPSPostBackendPiecesTest, AllMessagesAreMadeWithTheValuesOfTheFlush) {
  world.http.holdAnswers(true);
  world.dependencies.filterHeldEvents = true;
  const auto backend = makeWithPieces();
  startFlush(*backend);
  backend->setPostURL("https://elsewhere.example/post");
  backend->setUserInfoDict(Dictionary{{kTarnelUserInfoClientName, "Other"}});
  while (world.http.pendingCount() > 0) world.http.answerOldest(FakeHttpClient::status(200));
  const auto all = messages();
  const auto requests = world.http.requests();
  ASSERT_EQ(all.size(), 3U);
  for (size_t i = 0; i < 3; ++i) {
    EXPECT_EQ(requests[i].url, "https://events.example/post");
    EXPECT_EQ(*headerOf(requests[i], "X-TRN-Client-Name"), "Meetwell");
    EXPECT_EQ(*all[i].find("clientId"), *all[0].find("clientId"));
    EXPECT_TRUE(eventsOf(all[i])[0].contains("large"));
  }
}

TEST_F(HTTPSPostBackendPiecesTest, AServerErrorDropsTheRest) {
  for (const bool isGone : {false, true}) {
    told.clear();
    world.log.clear();
    world.http.clear();
    world.http.holdAnswers(true);
    auto backend = makeWithPieces(5);
    startFlush(*backend);
    if (isGone) backend.reset();
    world.http.answerOldest(FakeHttpClient::status(200));
    world.http.answerOldest(FakeHttpClient::status(503));
    const std::string text = "backend httppost disabled by server 503 return code";
    expectTold(Error(kTarnelErrorDomain, 503, text));
    expectLost(3, text);
    expectPosted(2);
  }
}

// The log tells why the rest is lost, the completion what went wrong first.
TEST_F(HTTPSPostBackendPiecesTest, AnEarlierErrorIsToldBeforeTheServerError) {
  world.http.holdAnswers(true);
  const auto backend = makeWithPieces();
  startFlush(*backend);
  const auto first = FakeHttpClient::failure("first");
  world.http.answerOldest(first);
  world.http.answerOldest(FakeHttpClient::status(500));
  expectTold(*first.error);
  expectLost(1, "backend httppost disabled by server 500 return code");
}

TEST_F(HTTPSPostBackendPiecesTest, ABackendThatIsDisabledMeanwhilePostsNoMore) {
  world.http.holdAnswers(true);
  const auto backend = makeWithPieces();
  startFlush(*backend);
  backend->setState(ReportingState::disabled);
  world.http.answerOldest(FakeHttpClient::status(200));
  expectTold(Error(kTarnelErrorDomain, -1, "Can not flush: the backend is disabled"));
  expectLost(2, "Can not flush: the backend is disabled");
  expectPosted(1);
}

TEST_F(HTTPSPostBackendPiecesTest, AClientThatGoesAwayIsGivenNoMore) {
  world.http.holdAnswers(true);
  const auto backend = makeWithPieces();
  startFlush(*backend);
  const Error goingAway(kHttpErrorDomain, kHttpClientGoingAway, "going away");
  world.http.answerOldest({std::nullopt, std::nullopt, goingAway});
  expectTold(goingAway);
  expectLost(2, "going away");
  expectPosted(1);
}

TEST_F(HTTPSPostBackendPiecesTest, AMessageThatDoesNotArriveDoesNotStopTheNext) {
  world.http.holdAnswers(true);
  const auto backend = makeWithPieces();
  startFlush(*backend);
  const Error noRoute(kHttpErrorDomain, 7, "no route");
  for (int i = 0; i < 3; ++i) world.http.answerOldest({std::nullopt, std::nullopt, noRoute});
  expectTold(noRoute);
  EXPECT_EQ(posts(), 3U);
}

TEST_F(HTTPSPostBackendPiecesTest, WhatTheClientRefusesUnsentStopsTheRestWhichIsCounted) {
  for (const int64_t code : {int64_t{kHttpTooMuchQueued}, int64_t{kHttpBadRequest}}) {
    SCOPED_TRACE(code);
    world.http.holdAnswers(true);
    world.log.clear();
    const size_t before = posts();
    const auto backend = makeWithPieces();
    const Error refused(kHttpErrorDomain, code, "not taken");
    MaybeError told;
    backend->flushMessagesWithCompletion(
        [&told](const MaybeString& /*text*/, MaybeError error) { told = std::move(error); });
    world.http.answerOldest({std::nullopt, std::nullopt, refused});
    EXPECT_EQ(told, refused);
    EXPECT_EQ(posts(), before + 1);
    expectLost(2, "not taken");
  }
}

TEST_F(HTTPSPostBackendPiecesTest, AnExceptionCostsOneMessage) {
  int started = 0;
  world.http.setAnswer([&started](const HttpRequest&) {
    if (++started == 2) throw std::runtime_error("no memory");
    return FakeHttpClient::status(200);
  });
  const auto backend = makeWithPieces();
  EXPECT_EQ(flush(*backend).second, Error(kTarnelErrorDomain, -1, "Can not flush: no memory"));
  EXPECT_EQ(posts(), 3U);
  expectLost(1, "Can not flush: no memory");
}

// However many messages are answered before their posts return.
TEST_F(HTTPSPostBackendPiecesTest, AnswersAtOnceDoNotRecurse) {
  std::vector<const void*> frames;
  world.http.setAnswer([&frames](const HttpRequest&) {
    frames.push_back(__builtin_frame_address(0));
    return FakeHttpClient::status(200);
  });
  const auto backend = makeWithPieces(6);
  flush(*backend);
  ASSERT_EQ(frames.size(), 6U);
  EXPECT_EQ(std::set<const void*>(frames.begin() + 1, frames.end()).size(), 1U);
}

// The call can only tell what it posted itself.
TEST_F(HTTPSPostBackendPiecesTest, TheCallReturnsTheTextOfTheFirstMessage) {
  world.http.holdAnswers(true);
  const auto backend = makeUpdated();
  for (int i = 0; i < 3; ++i) send(*backend, i);
  backend->setUserInfoDict(Dictionary{{"large", std::string(EventBatch::kMaxBytes / 5 * 2, 'x')}});
  const auto text = startFlush(*backend);
  while (world.http.pendingCount() > 0) world.http.answerOldest(FakeHttpClient::status(200));
  ASSERT_TRUE(text);
  ASSERT_TRUE(text->ends_with("}\n(and more messages)"));
  EXPECT_EQ(parsed(text->substr(0, text->rfind('\n'))), messages()[0]);
  ASSERT_EQ(told.size(), 1U);
  ASSERT_TRUE(told[0].first);
  EXPECT_GT(told[0].first->size(), text->size());
}

TEST_F(HTTPSPostBackendPiecesTest, AnswersBeforeTheLastPostDoNotCompleteTheFlush) {
  const auto backend = makeWithPieces();
  EXPECT_EQ(flush(*backend).second, std::nullopt);
  EXPECT_EQ(world.http.requests().size(), 3U);
}

TEST_F(HTTPSPostBackendPiecesTest, WithoutAnAddressOneErrorIsTold) {
  entry.remove("post_url");
  entry.remove("realtime_post_url");
  const auto backend = makeWithPieces();
  EXPECT_EQ(flush(*backend).second, Error(kTarnelErrorDomain, -1, "postURL is nil"));
  expectLost(2, "postURL is nil");
}

// The texts are for the log, which need not hold everything.
TEST_F(HTTPSPostBackendPiecesTest, TheTextTellsTheFirstMessagesAndHowManyMoreThereWere) {
  const auto backend = makeWithPieces();
  const auto [text, error] = flush(*backend);
  ASSERT_TRUE(text);
  EXPECT_LT(text->size(), EventBatch::kMaxBytes * 3 / 2);
  EXPECT_TRUE(text->ends_with("}\n(and 2 more messages)")) << text->substr(text->size() - 40);
}

TEST_F(HTTPSPostBackendPiecesTest, ShorterTextsAreToldOneAfterTheOther) {
  const auto backend = makeUpdated();
  for (int i = 0; i < 3; ++i) send(*backend, i);
  backend->setUserInfoDict(Dictionary{{"large", std::string(EventBatch::kMaxBytes / 5 * 2, 'x')}});
  const auto [text, error] = flush(*backend);
  const auto all = messages();
  ASSERT_EQ(all.size(), 2U);
  ASSERT_TRUE(text);
  const auto second = text->find("}\n{");
  ASSERT_NE(second, std::string::npos);
  EXPECT_EQ(parsed(text->substr(0, second + 1)), all[0]);
  EXPECT_EQ(parsed(text->substr(second + 2)), all[1]);
}

TEST_F(HTTPSPostBackendPiecesTest, WithoutConsentThereIsNoText) {
  entry.set("override_dnu", 1);
  const auto backend = makeWithPieces();
  EXPECT_EQ(flush(*backend).first, std::nullopt);
  EXPECT_EQ(world.http.requests().size(), 3U);
}

// What waits for servers is bounded for the whole process; nothing is lost by it.
TEST_F(HTTPSPostBackendPiecesTest, BeyondTheMostThatWaitTheRestStaysForTheNextFlush) {
  world.http.holdAnswers(true);
  const auto large = userInfo;
  std::vector<std::shared_ptr<HTTPSPostBackend>> backends;
  for (size_t i = 0; i < BatchPoster::kMaxWaiting; ++i) {
    userInfo = large;
    backends.push_back(makeWithPieces(2));
    startFlush(*backends.back());
  }
  userInfo = large;
  const auto last = makeWithPieces(3);
  startFlush(*last);
  expectLog(LogLevel::warning,
            "HTTPSPostBackend(flushMessagesWithCompletion): httppost: 2 events wait for the next flush: too "
            "many batches are being posted");
  ASSERT_EQ(posts(), BatchPoster::kMaxWaiting + 1);
  while (world.http.pendingCount() > 0) world.http.answerOldest(FakeHttpClient::status(200));
  ASSERT_EQ(told.size(), BatchPoster::kMaxWaiting + 1);
  EXPECT_EQ(told[BatchPoster::kMaxWaiting - 1].second, std::nullopt);
  world.http.clear();
  world.http.holdAnswers(false);
  EXPECT_EQ(flush(*last).second, std::nullopt);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 2U);
  EXPECT_EQ(*events[0].find("_method"), Value(1));
  EXPECT_EQ(*events[1].find("_method"), Value(2));
}

}  // namespace
}  // namespace tarnel
