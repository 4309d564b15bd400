#include "backends/https/https_post_backend_fixture.h"

// What is set in events that are batched already: user information at the flush, identifiers at any time.

namespace tarnel {
namespace {

class HTTPSPostBackendBatchTest : public HTTPSPostBackendFixture {
 protected:
  // Each takes a little more than a 64th of what a batch may hold.
  static Dictionary sixtyFourth() {
    return {{"a", 1}, {"text", std::string(EventBatch::kMaxBytes / 64, 'x')}};
  }
};

// The largest user information that a session keeps. The events grow by it to much more than a batch may
// hold; all are posted, in messages that are each within that bound.
TEST_F(HTTPSPostBackendBatchTest, UserInfoThatComesLateCostsNoEvent) {
  const auto late = userInfo;
  userInfo.reset();
  const auto backend = makeUpdated();
  constexpr int kEvents = 2000;
  for (int i = 0; i < kEvents; ++i) send(*backend, i);
  userInfo = late;
  userInfo->set("large", std::string((64U << 10U) - 200, 'x'));
  backend->setUserInfoDict(userInfo);
  backend->updateState();
  EXPECT_EQ(flush(*backend).second, std::nullopt);
  int next = 0;
  const auto requests = world.http.requests();
  EXPECT_GT(requests.size(), 30U);
  for (const auto& request : requests) {
    const std::string body = bodyText(request);
    EXPECT_LE(body.size(), EventBatch::kMaxBytes);
    constexpr std::string_view kMethod = "\"_method\":";
    for (size_t at = body.find(kMethod); at != std::string::npos; at = body.find(kMethod, at + 1)) {
      EXPECT_EQ(Value(body.substr(at + kMethod.size(), 8)).int64Value(), next++);
    }
  }
  EXPECT_EQ(next, kEvents);
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(batchEvent)").empty());
  EXPECT_EQ(flush(*backend).second, Error(kTarnelErrorDomain, -1, "Nothing to flush"));
}

TEST_F(HTTPSPostBackendBatchTest, HeldEventsThatFitAreOneMessage) {
  const auto late = userInfo;
  userInfo.reset();
  const auto backend = makeUpdated();
  for (int i = 0; i < 200; ++i) send(*backend, i);
  userInfo = late;
  backend->setUserInfoDict(userInfo);
  backend->updateState();
  flush(*backend);
  EXPECT_EQ(messages().size(), 1U);
  EXPECT_EQ(postedEvents().size(), 200U);
}

TEST_F(HTTPSPostBackendBatchTest, CorrelatedIdentifierRelabelsTheBatch) {
  const auto backend = makeUpdated();
  backend->setCombinedSessionIDString("own");
  send(*backend);
  send(*backend);
  backend->setCorrelatedSessionID("top.own");
  send(*backend);
  flush(*backend);
  EXPECT_EQ(backend->combinedSessionIDString(), "top.own");
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 3U);
  for (const auto& event : events) EXPECT_EQ(*event.find("_sessionID"), Value("top.own"));
}

TEST_F(HTTPSPostBackendBatchTest, CorrelatedIdentifierReplacesSessionNumbersToo) {
  internal = true;
  const auto backend = makeUpdated();
  backend->setCompType(7);
  send(*backend);
  backend->setCorrelatedSessionID("top.own");
  send(*backend);
  flush(*backend);
  EXPECT_EQ(*postedEvents().at(0).find("_sessionID"), Value("top.own"));
  EXPECT_EQ(*postedEvents().at(1).find("_sessionID"), Value(77));
}

TEST_F(HTTPSPostBackendBatchTest, CorrelatedIdentifierWithoutABatchMakesNone) {
  const auto backend = makeUpdated();
  backend->setCorrelatedSessionID("top.own");
  EXPECT_EQ(flush(*backend).second, Error(kTarnelErrorDomain, -1, "Nothing to flush"));
  backend->setCorrelatedSessionID(std::nullopt);
  EXPECT_EQ(backend->combinedSessionIDString(), std::nullopt);
}

// However long it is: nearly full, the batch keeps its events, and room for no fewer.
TEST_F(HTTPSPostBackendBatchTest, CorrelatedIdentifierCostsNoEvent) {
  const auto backend = makeUpdated();
  backend->setState(ReportingState::undecided);
  for (int i = 0; i < 60; ++i) send(*backend, i, Flag::normal, sixtyFourth());
  const std::string label(EventBatch::kMaxBytes / 64, 'i');
  backend->setCorrelatedSessionID(label);
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(batchEvent)").empty());
  backend->setState(ReportingState::enabled);
  flush(*backend);
  EXPECT_EQ(messages().size(), 2U);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 60U);
  for (size_t i = 0; i < 60; ++i) {
    EXPECT_EQ(*events[i].find("_method"), Value(i));
    EXPECT_EQ(*events[i].find("_sessionID"), Value(label));
  }
}

TEST_F(HTTPSPostBackendBatchTest, NoCorrelatedIdentifierLeavesTheEventsTheirs) {
  const auto backend = makeUpdated();
  backend->setCombinedSessionIDString("own");
  send(*backend);
  backend->setCorrelatedSessionID(std::nullopt);
  flush(*backend);
  EXPECT_EQ(*postedEvents().at(0).find("_sessionID"), Value("own"));
}

TEST_F(HTTPSPostBackendBatchTest, EachBatchThatOverflowsSaysSoOnce) {
  const auto backend = makeUpdated();
  for (size_t batches = 1; batches <= 2; ++batches) {
    backend->setState(ReportingState::sampledOut);
    for (int i = 0; i < 70; ++i) send(*backend, i, Flag::normal, sixtyFourth());
    EXPECT_EQ(world.log.startingWith("HTTPSPostBackend(batchEvent): httppost").size(), batches);
    flush(*backend);
  }
}

TEST_F(HTTPSPostBackendBatchTest, UserInfoGoesBeforeTheCorrelatedIdentifier) {
  const auto backend = makeUpdated();
  send(*backend);
  backend->setCorrelatedSessionID("top.own");
  backend->setUserInfoDict(Dictionary{{"_sessionID", "mine"}});
  flush(*backend);
  EXPECT_EQ(*postedEvents().at(0).find("_sessionID"), Value("mine"));
}

// The events hold the user information since they were made: the flush has nothing to add, however full the
// batch.
TEST_F(HTTPSPostBackendBatchTest, FlushOfAFullBatchLosesNothingToTheSameUserInfo) {
  userInfo->set("large", std::string(EventBatch::kMaxBytes / 64, 'x'));
  const auto backend = makeUpdated();
  for (int i = 0; i < 60; ++i) send(*backend, i);
  flush(*backend);
  EXPECT_EQ(messages().size(), 1U);
  EXPECT_EQ(postedEvents().size(), 60U);
}

}  // namespace
}  // namespace tarnel
