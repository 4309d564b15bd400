#include <gtest/gtest.h>

#include "session/test_session_fixture.h"

// Sessions and the real dashboard backend. A session dispatches through the flagged send and the dashboard
// has only an unflagged one, so that no message of a client leaves the device as a datagram.

namespace tarnel::fake {
namespace {

class SessionDashboard : public SessionTest {
 protected:
  SessionDashboard() {
    session = TarneldSession::initWithSessionDelegate(world.dependencies, delegate, connection,
                                                      TarnelBackend::newBackendWithName);
    delegate->version = "5.1";
    delegate->storebag = Dictionary{
        {kTarnelBackendDashboard,
         Dictionary{
             {"ip", "192.0.2.7"}, {"port", 8125}, {"reliable", 500}, {"post_url", "https://up.example"}}}};
    configureAndStart();
  }
  void expectNoDatagram() {
    world.workQueues.advance(std::chrono::seconds(30));
    ASSERT_EQ(world.datagramSockets.records.size(), 1U);
    EXPECT_EQ(world.datagramSockets.last().sends, 0);
    EXPECT_TRUE(messageLog().empty());
  }
};

TEST_F(SessionDashboard, MessagesOfASessionMakeNoDatagramsAndNoLines) {
  EXPECT_EQ(session->sendMessageWithCategory(3, 4, Dictionary{{"a", 1}}), std::nullopt);
  expectNoDatagram();
}

TEST_F(SessionDashboard, UploadedLogDataIsPostedAndNotAnnounced) {
  bool answer = false;
  session->uploadLogData(Array{Dictionary{{"text", "one"}}},
                         [&answer](bool success, const MaybeError& /*error*/) { answer = success; });
  EXPECT_TRUE(answer);
  EXPECT_EQ(world.http.requests().size(), 1U);
  expectNoDatagram();
}

TEST_F(SessionDashboard, SessionThatEndsLeavesNothingOfIt) {
  EXPECT_EQ(world.datagramSockets.open(), 1U);
  EXPECT_EQ(world.workQueues.timers(), 1U);
  session.reset();
  world.workQueues.runUntilIdle();
  EXPECT_EQ(world.datagramSockets.open(), 0U);
  EXPECT_EQ(world.workQueues.timers(), 0U);
  EXPECT_EQ(world.workQueues.readSources(), 0U);
}

}  // namespace
}  // namespace tarnel::fake
