#include "backends/https/https_post_backend_fixture.h"

// In which states a flush discards the batch, and in which it keeps it.

namespace tarnel {
namespace {

class HTTPSPostBackendDiscardTest : public HTTPSPostBackendFixture {
 protected:
  size_t posts() const { return world.http.requests().size(); }
  void expectNothingToFlush(TarnelBackend& backend) {
    const auto [text, error] = flush(backend);
    EXPECT_EQ(text, std::nullopt);
    EXPECT_EQ(error, Error(kTarnelErrorDomain, -1, "Nothing to flush"));
  }
};

TEST_F(HTTPSPostBackendDiscardTest, FlushInAnyStateButEnabledDiscardsTheBatch) {
  for (const auto state : {ReportingState::undecided, ReportingState::disabled, ReportingState::sampledOut}) {
    for (const bool required : {true, false}) {
      requireUserInfo = required;
      const auto backend = makeUpdated();
      send(*backend);
      backend->setState(state);
      expectNothingToFlush(*backend);
      backend->setState(ReportingState::enabled);
      expectNothingToFlush(*backend);
    }
  }
  EXPECT_EQ(posts(), 0U);
}

TEST_F(HTTPSPostBackendDiscardTest, DiscardComesBeforeTheQuestionForUserInfo) {
  for (const auto state : {ReportingState::disabled, ReportingState::sampledOut}) {
    userInfo.reset();
    const auto backend = makeUpdated();
    send(*backend);
    backend->setState(state);
    expectNothingToFlush(*backend);
    backend->setState(ReportingState::undecided);
    expectNothingToFlush(*backend);
  }
}

TEST_F(HTTPSPostBackendDiscardTest, UndecidedWithUserInfoThatIsNotRequiredDiscards) {
  requireUserInfo = false;
  userInfo.reset();
  const auto backend = makeUpdated();
  backend->setState(ReportingState::undecided);
  send(*backend);
  expectNothingToFlush(*backend);
}

// The events are wanted when the user information comes.
TEST_F(HTTPSPostBackendDiscardTest, UndecidedForWantOfUserInfoKeepsTheBatch) {
  const auto late = userInfo;
  userInfo.reset();
  const auto backend = makeUpdated();
  ASSERT_EQ(backend->state(), ReportingState::undecided);
  expectNothingToFlush(*backend);
  send(*backend, 3);
  const auto [text, error] = flush(*backend);
  EXPECT_EQ(text, std::nullopt);
  EXPECT_EQ(error, Error(kTarnelErrorDomain, -1, "Can not flush: userInfo is required"));
  EXPECT_EQ(backend->flushMessagesWithCompletion({}), std::nullopt);
  EXPECT_TRUE(world.log.startingWith("HTTPSPostBackend(flushMessages").empty());
  send(*backend, 4);
  backend->setUserInfoDict(late);
  backend->updateState();
  EXPECT_EQ(flush(*backend).second, std::nullopt);
  const auto events = postedEvents();
  ASSERT_EQ(events.size(), 2U);
  EXPECT_EQ(*events[0].find("_method"), Value(3));
  EXPECT_EQ(*events[1].find("_method"), Value(4));
}

// The threshold of a method asks for a flush, too.
TEST_F(HTTPSPostBackendDiscardTest, ManyHeldEventsOfOneMethodAreKeptForTheUserInfo) {
  const auto late = userInfo;
  userInfo.reset();
  const auto backend = makeUpdated();
  for (int i = 0; i < 120; ++i) send(*backend, 3);
  backend->setUserInfoDict(late);
  backend->updateState();
  flush(*backend);
  EXPECT_EQ(postedEvents().size(), 120U);
}

}  // namespace
}  // namespace tarnel
