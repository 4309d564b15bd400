#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "session/test_session_fixture.h"

// Reporting states and identifiers that a session takes from its parent.

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class SessionSync : public SessionTest {
 protected:
  // The parent's backends go with this class; it must not outlive them.
  ~SessionSync() override { delegate->parent.reset(); }

  // A parent session with these backends, all at this state and threshold.
  void giveParent(const std::vector<std::string>& names, ReportingState state,
                  std::optional<Value> threshold) {
    parentBackends.scripts.clear();
    for (const auto& name : names) {
      parentBackends.scripts[name].decides = state;
      parentBackends.scripts[name].threshold = threshold;
    }
    parentDelegate->storebag = sectionOf(names);
    auto parent = TarneldSession::initWithSessionDelegate(
        world.dependencies, parentDelegate, std::make_shared<FakeIpcConnection>(), parentBackends.factory());
    parent->setSessionInfo(info(1), user(), std::nullopt, false);
    parent->startConfigWithCompletionHandler(nullptr);
    world.log.clear();
    delegate->parent = parent;
  }

  ReportingState stateOf(const std::string& name) { return backends.last(name)->state(); }

  FakeBackends parentBackends;
  std::shared_ptr<FakeDelegate> parentDelegate = std::make_shared<FakeDelegate>(parentBackends.journal);
};

TEST_F(SessionSync, ChildTakesStateAndThresholdOfItsParentsBackend) {
  giveParent({"httppost"}, ReportingState::disabled, Value(0.25));
  offer({"httppost"});
  backends.scripts["httppost"].threshold = Value(0.5);
  session->setSessionInfo(info(), user(), std::nullopt, false);
  session->startConfigWithCompletionHandler(nullptr);
  EXPECT_EQ(stateOf("httppost"), ReportingState::disabled);
  EXPECT_EQ(backends.last("httppost")->samplingThreshold(), Value(0.25));
  EXPECT_TRUE(logged(LogLevel::debug,
                     "HTTPSPostBackend(syncReportingStates): httppost: state and sampling rate updated to 1, "
                     "0.25%"));
}

TEST_F(SessionSync, AMissingThresholdIsCopiedAndPrintedAsZero) {
  giveParent({"httppost"}, ReportingState::sampledOut, std::nullopt);
  offer({"httppost"});
  backends.scripts["httppost"].threshold = Value(0.5);
  configureAndStart();
  EXPECT_EQ(stateOf("httppost"), ReportingState::sampledOut);
  EXPECT_FALSE(backends.last("httppost")->samplingThreshold());
  backends.last("httppost")->setState(ReportingState::enabled);
  session->syncReportingStates();
  EXPECT_TRUE(logged(LogLevel::debug,
                     "HTTPSPostBackend(syncReportingStates): httppost: state and sampling rate updated to 3, "
                     "0.00%"));
}

TEST_F(SessionSync, AChildThatIsSampledOutKeepsItsStateAndThreshold) {
  giveParent({"httppost"}, ReportingState::enabled, Value(0.25));
  offer({"httppost", "dashboard"});
  for (auto& [name, script] : backends.scripts) {
    script.decides = ReportingState::sampledOut;
    script.threshold = Value(0.5);
  }
  configureAndStart();
  EXPECT_EQ(stateOf("httppost"), ReportingState::sampledOut);
  EXPECT_EQ(backends.last("httppost")->samplingThreshold(), Value(0.5));
  EXPECT_EQ(stateOf("dashboard"), ReportingState::sampledOut);
  session->syncReportingStates();
  EXPECT_THAT(world.log.startingWith("HTTPSPostBackend(syncReportingStates)"), IsEmpty());
}

TEST_F(SessionSync, ABackendThatTheParentLacksIsDisabled) {
  giveParent({"httppost"}, ReportingState::enabled, std::nullopt);
  offer({"httppost", "dashboard"});
  backends.scripts["dashboard"].threshold = Value(0.5);
  configureAndStart();
  EXPECT_EQ(stateOf("httppost"), ReportingState::enabled);
  EXPECT_EQ(stateOf("dashboard"), ReportingState::disabled);
  EXPECT_EQ(backends.last("dashboard")->samplingThreshold(), Value(0.5));
}

TEST_F(SessionSync, AChildWithoutItsParentSaysSoForEachDeeperBackend) {
  offer({"httppost", "httppost2", "dashboard"});
  backends.scripts["httppost"].hierarchy = 1;
  backends.scripts["httppost2"].hierarchy = 2;
  configureAndStart();
  session->syncReportingStates();
  EXPECT_TRUE(logged(LogLevel::information,
                     "syncReportingStates: child session 7 (backend httppost) with hierarchy 1 is missing "
                     "its parent"));
  EXPECT_TRUE(logged(LogLevel::information,
                     "syncReportingStates: child session 7 (backend httppost2) with hierarchy 2 is missing "
                     "its parent"));
  EXPECT_EQ(world.log.startingWith("syncReportingStates").size(), 2U);
  EXPECT_EQ(stateOf("httppost"), ReportingState::enabled);
}

TEST_F(SessionSync, ParentIsAskedForUnderTheAgentsLock) {
  session->syncReportingStates();
  EXPECT_TRUE(delegate->isParentAskedLocked);
  EXPECT_FALSE(delegate->isLocked());
}

TEST_F(SessionSync, CombinedIdentifierIsTheParentsAndOnesOwn) {
  offer({"httppost"});
  delegate->parentID = "TOP.MIDDLE";
  configureAndStart();
  const std::string combined = "TOP.MIDDLE." + session->sessionIDString();
  EXPECT_EQ(backends.last("httppost")->combinedSessionIDString(), combined);
  session->updateCombinedSessionID();
  EXPECT_TRUE(logged(LogLevel::debug, "updateCombinedSessionID: Updating combined session ID '" + combined +
                                          "' for session 7 backends"));
}

TEST_F(SessionSync, WithoutParentTheIdentifierStays) {
  offer({"httppost"});
  configureAndStart();
  session->updateCombinedSessionID();
  EXPECT_THAT(world.log.startingWith("updateCombinedSessionID"), IsEmpty());
  EXPECT_EQ(backends.last("httppost")->combinedSessionIDString(), session->sessionIDString());
}

// What other sessions change reaches the backends with this session's next own step.

TEST_F(SessionSync, AnIdentifierFromAnotherSessionIsAppliedBeforeTheNextMessage) {
  offer({"httppost"});
  configureAndStart();
  session->sendMessageWithCategory(1, 2, std::nullopt);
  delegate->parentID = "TOP";
  session->updateCombinedSessionID();
  EXPECT_THAT(backends.journal.lines(), ElementsAre("httppost send 1/2"));
  session->sendMessageWithCategory(3, 4, std::nullopt);
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("httppost send 1/2", "httppost setCorrelatedSessionID", "httppost send 3/4"));
  for (const auto& event : backends.last("httppost")->sent) {
    EXPECT_EQ(event.sessionID, "TOP." + session->sessionIDString());
  }
}

TEST_F(SessionSync, ABackendThatRefusesAnIdentifierKeepsItFromNoOther) {
  offer({"httppost", "dashboard"});
  configureAndStart();
  backends.scripts["httppost"].correlatedSessionIDThrows = true;
  delegate->parentID = "TOP";
  session->updateCombinedSessionID();
  session->sendMessageWithCategory(3, 4, std::nullopt);
  EXPECT_THAT(backends.journal.lines(),
              ElementsAre("httppost setCorrelatedSessionID", "dashboard setCorrelatedSessionID",
                          "httppost send 3/4", "dashboard send 3/4"));
  EXPECT_TRUE(logged(LogLevel::error, "applyNotes: httppost failed: label went wrong"));
}

TEST_F(SessionSync, AStateFromAnotherSessionHoldsAtOnceAndAThresholdIsSeenAtOnce) {
  offer({"httppost"});
  configureAndStart();
  giveParent({"httppost"}, ReportingState::disabled, Value(0.125));
  session->syncReportingStates();
  EXPECT_EQ(stateOf("httppost"), ReportingState::disabled);
  EXPECT_EQ(session->reports().at(0).samplingThreshold, Value(0.125));
  EXPECT_FALSE(backends.last("httppost")->samplingThreshold());
  session->flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(backends.last("httppost")->samplingThreshold(), Value(0.125));
}

TEST_F(SessionSync, WhatWasNotedForReplacedBackendsIsVoid) {
  offer({"httppost"});
  configureAndStart();
  delegate->parentID = "TOP";
  session->updateCombinedSessionID();
  delegate->parentID.reset();
  session->startConfigWithCompletionHandler(nullptr);
  EXPECT_EQ(backends.last("httppost")->combinedSessionIDString(), session->sessionIDString());
}

TEST_F(SessionSync, TheStopMessageCarriesTheLastIdentifier) {
  offer({"httppost"});
  configureAndStart();
  delegate->parentID = "TOP";
  session->updateCombinedSessionID();
  const auto backend = backends.last("httppost");
  const std::string own = session->sessionIDString();
  session.reset();
  EXPECT_EQ(backend->sent.back().respCode, RespCode{1});
  EXPECT_EQ(backend->sent.back().sessionID, "TOP." + own);
}

}  // namespace
}  // namespace tarnel::fake
