#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <new>
#include <stdexcept>

#include "session/test_session_fixture.h"

// What happens when the last reference to a session goes.

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;

class SessionEnd : public SessionTest {};

TEST_F(SessionEnd, DeallocStopsFlushesShutsDownAndCleansUpInThatOrder) {
  offer({kTarnelBackendHTTPPost, kTarnelBackendDashboard});
  configureAndStart(true);
  session->dealloc();
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("httppost send 0/1", "dashboard send 0/1", "httppost flush", "dashboard flush",
                          "httppost cleanup", "dashboard cleanup"));
  const Lines expected = {"dealloc: TarneldSession dealloc: 7",
                          "internalSendMessage: Sent internal message (method:0 respCode:1)",
                          "flushMessagesWithCompletion: Flushing messages for session 7",
                          "shutdownSessionAggregation: Disable aggregation module for session 7"};
  Lines seen;
  for (const auto& line : world.log.lines()) {
    for (const auto& text : expected) {
      if (line.text == text && line.level == LogLevel::debug) seen.push_back(text);
    }
  }
  EXPECT_EQ(seen, expected);
  EXPECT_EQ(backends.last(kTarnelBackendHTTPPost)->sent.back().payload,
            (Dictionary{{"StorebagVersion", "5.1"}}));
  ASSERT_EQ(connection->sentToClient().size(), 3U);  // start, stop, end of aggregation
  EXPECT_FALSE(connection->sentToClient().back().messageInfo);
  EXPECT_TRUE(session->backends().empty());
  EXPECT_FALSE(session->storebagVersion());
  EXPECT_FALSE(session->userInfo());
  EXPECT_FALSE(session->sessionInfo());
}

TEST_F(SessionEnd, AClientThatCannotBeToldKeepsNothingOfTheEndFromTheBackends) {
  offer({kTarnelBackendHTTPPost});
  configureAndStart(true);
  connection->whenProxyIsAsked = [] { throw std::runtime_error("no memory"); };
  session.reset();
  EXPECT_EQ(world.log.count(LogLevel::error, "sendToAggregator: the call of the client failed: no memory"),
            2U);
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("httppost send 0/1", "httppost flush", "httppost cleanup"));
}

TEST_F(SessionEnd, BackendsThatFailAtTheEndKeepNothingFromTheOthers) {
  offer({kTarnelBackendHTTPPost, kTarnelBackendDashboard});
  configureAndStart(true);
  auto& script = backends.scripts[kTarnelBackendHTTPPost];
  script.sendThrows = true;
  script.flushThrows = true;
  script.cleanupThrows = true;
  session.reset();
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("httppost send 0/1", "dashboard send 0/1", "httppost flush", "dashboard flush",
                          "httppost cleanup", "dashboard cleanup"));
  EXPECT_TRUE(logged(LogLevel::error, "sendMessageWithDictionary: httppost failed: send went wrong"));
  EXPECT_TRUE(
      logged(LogLevel::error, "internalFlushMessagesWithCompletion: httppost failed: flush went wrong"));
  EXPECT_TRUE(logged(LogLevel::error, "cleanup: httppost failed: cleanup went wrong"));
  EXPECT_FALSE(connection->sentToClient().back().messageInfo);  // aggregation has ended
}

// Each step of the end, failing for a reason of its own: the log has no memory for one of its lines.
TEST_F(SessionEnd, EachStepOfTheEndStandsAlone) {
  struct Case {
    std::string failsAt;
    std::string line;
    Lines done;
  };
  const std::vector<Case> cases{{"internalSendMessage: Sent internal message (method:0 respCode:1)",
                                 "dealloc: the stop message failed: no memory",
                                 {"httppost send 0/1", "httppost flush", "told", "httppost cleanup"}},
                                {"flushMessagesWithCompletion: Flushing messages for session 7",
                                 "dealloc: the last flush failed: no memory",
                                 {"httppost send 0/1", "told", "httppost cleanup"}},
                                {"shutdownSessionAggregation: Disable aggregation module for session 7",
                                 "dealloc: the end of aggregation failed: no memory",
                                 {"httppost send 0/1", "httppost flush", "httppost cleanup"}}};
  offer({kTarnelBackendHTTPPost});
  for (const auto& [failsAt, line, done] : cases) {
    session = newSession(connection);
    configureAndStart(true);
    world.log.whenWritten = [&failsAt = failsAt](std::string_view text) {
      if (text == failsAt) throw std::runtime_error("no memory");
    };
    connection->whenProxyIsAsked = [this, asked = 0]() mutable {
      if (++asked == 2) backends.journal.add("told");  // the first is for the stop message
    };
    session.reset();
    world.log.whenWritten = nullptr;
    connection->whenProxyIsAsked = nullptr;
    EXPECT_EQ(backends.journal.lines(), done) << failsAt;
    EXPECT_TRUE(logged(LogLevel::error, line));
    EXPECT_EQ(delegate.use_count(), 1);
  }
}

// A log that has no memory for what it is told first, or for what it is told of a failure.
TEST_F(SessionEnd, NoLineThatCannotBeWrittenEndsTheProcess) {
  offer({kTarnelBackendHTTPPost, kTarnelBackendDashboard});
  for (const std::string failsAt :
       {"dealloc: TarneldSession dealloc: 7", "cleanup: httppost failed: cleanup went wrong",
        "dealloc: ", "cleanup: ", ""}) {
    backends.scripts[kTarnelBackendHTTPPost].cleanupThrows = true;
    session = newSession(connection);
    configureAndStart(true);
    size_t failures = 0;
    world.log.whenWritten = [&failsAt, &failures](std::string_view text) {
      if (!text.starts_with(failsAt)) return;
      ++failures;
      throw std::bad_alloc();
    };
    session.reset();
    world.log.whenWritten = nullptr;
    EXPECT_GE(failures, 1U) << failsAt;
    const Lines done = backends.journal.lines();
    ASSERT_GE(done.size(), 2U) << failsAt;
    EXPECT_EQ(Lines(done.end() - 2, done.end()), (Lines{"httppost cleanup", "dashboard cleanup"})) << failsAt;
    if (!failsAt.empty()) {
      EXPECT_EQ(done.size(), 6U) << failsAt;
    }
    EXPECT_EQ(delegate.use_count(), 1) << failsAt;
  }
}

TEST_F(SessionEnd, DeallocHappensOnce) {
  session->dealloc();
  const size_t lines = world.log.lines().size();
  session.reset();
  EXPECT_EQ(world.log.lines().size(), lines);
}

TEST_F(SessionEnd, DestructorDoesWhatDeallocDoes) {
  offer({kTarnelBackendHTTPPost});
  configureAndStart();
  const auto backend = backends.last(kTarnelBackendHTTPPost);
  session.reset();
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("httppost send 0/1", "httppost flush", "httppost cleanup"));
  EXPECT_EQ(delegate.use_count(), 1);
  EXPECT_EQ(connection.use_count(), 1);
  EXPECT_EQ(backend->sent.back().payload, (Dictionary{{"StorebagVersion", "5.1"}}));
}

TEST_F(SessionEnd, SessionDestroyedBeforeConfigurationStillSendsAnEmptyStopMessage) {
  session->setHasAggregator(true);
  session.reset();
  EXPECT_TRUE(logged(LogLevel::debug, "internalSendMessage: Sent internal message (method:0 respCode:1)"));
  EXPECT_TRUE(logged(LogLevel::debug, "sendMessageWithDictionary: No backends available to send message"));
}

TEST_F(SessionEnd, StopMessageWithoutAStorebagVersionHasAnEmptyPayload) {
  offer({kTarnelBackendHTTPPost});
  delegate->version.reset();
  configureAndStart();
  const auto backend = backends.last(kTarnelBackendHTTPPost);
  session.reset();
  EXPECT_EQ(backend->sent.back().respCode, RespCode{1});
  EXPECT_EQ(backend->sent.back().payload, Dictionary());
}

}  // namespace
}  // namespace tarnel::fake
