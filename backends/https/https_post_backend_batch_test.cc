#include "backends/https/https_post_backend_fixture.h"
#include "backends/https/text_format.h"

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

// A client may keep back a large user information until many events are held.
TEST_F(HTTPSPostBackendBatchTest, UserInfoThatComesLateDoesNotOutgrowTheBound) {
  const auto late = userInfo;
  userInfo.reset();
  const auto backend = makeUpdated();
  for (int i = 0; i < 40; ++i) send(*backend);
  userInfo = late;
  userInfo->set("large", std::string(1U << 20U, 'x'));
  backend->setUserInfoDict(userInfo);
  backend->updateState();
  flush(*backend);
  EXPECT_EQ(postedEvents().size(), 3U);
  expectLog(
      LogLevel::warning,
      "HTTPSPostBackend(flushMessagesWithCompletion): httppost: the oldest 37 events are dropped, since "
      "with the user information all would exceed 4194304 bytes");
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

constexpr char kRelabelled[] =
    "HTTPSPostBackend(setCorrelatedSessionID): httppost: the oldest %zu events are dropped, since with the "
    "identifier of the session all would exceed 4194304 bytes";

// What cannot be flushed yet is labelled again and goes on growing.
TEST_F(HTTPSPostBackendBatchTest, CorrelatedIdentifierCountsInTheBoundFromThenOn) {
  const auto backend = makeUpdated();
  backend->setState(ReportingState::undecided);
  for (int i = 0; i < 31; ++i) send(*backend, i, Flag::normal, sixtyFourth());
  // Now they take twice the room.
  backend->setCorrelatedSessionID(std::string(EventBatch::kMaxBytes / 64, 'i'));
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(setCorrelatedSessionID)").empty());
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(batchEvent)").empty());
  for (int i = 31; i < 40; ++i) send(*backend, i, Flag::normal, sixtyFourth());
  EXPECT_FALSE(world.log.startingWith("HTTPSPostBackend(batchEvent)").empty());
  backend->setState(ReportingState::enabled);
  flush(*backend);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 31U);
  EXPECT_EQ(*events.front().find("_method"), Value(9));
  EXPECT_EQ(*events.back().find("_method"), Value(39));
}

TEST_F(HTTPSPostBackendBatchTest, CorrelatedIdentifierOnANearlyFullBatchDropsTheOldestAndSaysSo) {
  const auto backend = makeUpdated();
  backend->setState(ReportingState::undecided);
  for (int i = 0; i < 60; ++i) send(*backend, i, Flag::normal, sixtyFourth());
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(batchEvent)").empty());
  backend->setCorrelatedSessionID(std::string(EventBatch::kMaxBytes / 64, 'i'));
  expectLog(LogLevel::warning, formatText(kRelabelled, size_t{29}));
  backend->setState(ReportingState::enabled);
  flush(*backend);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 31U);
  EXPECT_EQ(*events.front().find("_method"), Value(29));
}

// The events hold the user information since they were made: the flush has nothing to add, however full the
// batch.
TEST_F(HTTPSPostBackendBatchTest, FlushOfAFullBatchLosesNothingToTheSameUserInfo) {
  userInfo->set("large", std::string(EventBatch::kMaxBytes / 64, 'x'));
  const auto backend = makeUpdated();
  for (int i = 0; i < 60; ++i) send(*backend, i);
  flush(*backend);
  EXPECT_EQ(postedEvents().size(), 60U);
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(flushMessagesWithCompletion): httppost").empty());
}

}  // namespace
}  // namespace tarnel
