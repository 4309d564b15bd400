#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <thread>

#include "daemon/test_agent_fixture.h"

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class AgentHierarchy : public AgentTest {
 protected:
  std::vector<std::shared_ptr<TarneldSession>> listed(const std::string& key = "phone:call") {
    const auto lists = agent->correlatedSessions();
    const auto found = lists.find(key);
    return found == lists.end() ? std::vector<std::shared_ptr<TarneldSession>>() : found->second;
  }
  static const TarnelBackend& backendOf(const Client& client) {
    return *client.session->backends().find(kTarnelBackendHTTPPost);
  }
  // Runs the step once, right after the line.
  void whenLogged(const std::string& line, std::function<void()> step) {
    world.log.whenWritten = [this, line, step = std::move(step)](std::string_view text) {
      if (text != line) return;
      const auto once = step;
      world.log.whenWritten = nullptr;
      once();
    };
  }
  // The session decides its level anew.
  void standAt(const Client& client, int32_t level) {
    backends.scripts[kTarnelBackendHTTPPost].hierarchy = level;
    client.session->updateReportingStates();
  }
};

TEST_F(AgentHierarchy, SessionsAreFiledUnderTheLowerCasedNames) {
  const Client a = start("A", 1, 0);
  const Client b = start("B", 2, 1, false, "PHONE");
  EXPECT_THAT(listed(), ElementsAre(a.session, b.session));
  EXPECT_TRUE(logged(LogLevel::debug,
                     "userInfoUpdatedForSession: Adding session 2 to list for userInfoKey phone:call"));
}

TEST_F(AgentHierarchy, SessionWithoutUserInfoIsNotFiled) {
  const Client a = connect();
  a.session->setSessionInfo(info(5, 8), std::nullopt, std::nullopt, false);
  agent->userInfoUpdatedForSession(*a.session);
  EXPECT_TRUE(logged(LogLevel::information, "userInfoUpdatedForSession: No user info found for session 5"));
  EXPECT_THAT(agent->correlatedSessions(), IsEmpty());
}

TEST_F(AgentHierarchy, ChangedNamesMoveTheSessionAndTheOldListStays) {
  const Client a = start("A", 1, 0);
  a.session->receivedUserInfo(user("Phone", "Video"));
  EXPECT_THAT(listed("phone:call"), IsEmpty());
  EXPECT_THAT(listed("phone:video"), ElementsAre(a.session));
  EXPECT_EQ(agent->correlatedSessions().size(), 2U);
}

TEST_F(AgentHierarchy, FilingAnewUnderTheSameKeyGoesToTheEnd) {
  const Client a = start("A", 1, 0);
  const Client b = start("B", 2, 0);
  world.log.clear();
  a.session->receivedUserInfo(user("PHONE"));
  EXPECT_THAT(listed(), ElementsAre(b.session, a.session));
  EXPECT_TRUE(logged(LogLevel::debug,
                     "userInfoUpdatedForSession: Adding session 1 to list for userInfoKey phone:call"));
  EXPECT_EQ(agent->correlatedSessions().size(), 1U);
}

TEST_F(AgentHierarchy, WhatNeedsNoWalkTakesNoLock) {
  const Client top = start("A", 1, 0);
  const Client nobody = connect();
  const LockGuard guard(agent->agentLock());
  std::thread([this, &top, &nobody] {
    agent->userInfoUpdatedForSession(*nobody.session);
    agent->updateDownstreamSessions(*nobody.session);
    agent->getAncestorWithAggregatorForSession(*nobody.session);
    agent->parentSessionIDStringForSession(*top.session);
    agent->getAncestorWithAggregatorForSession(*top.session);
  }).join();
}

TEST_F(AgentHierarchy, TopLevelSessionHasNoParent) {
  const Client a = start("A", 1, 0);
  world.log.clear();
  EXPECT_EQ(agent->parentSessionForChild(*a.session), nullptr);
  EXPECT_FALSE(agent->parentSessionIDStringForSession(*a.session));
  EXPECT_THAT(world.log.lines(), IsEmpty());
}

TEST_F(AgentHierarchy, ParentIsTheFirstSessionOneLevelUp) {
  const Client first = start("A1", 1, 0);
  const Client second = start("A2", 2, 0);
  const Client child = start("B", 3, 1);
  EXPECT_EQ(agent->parentSessionForChild(*child.session), first.session);
  EXPECT_TRUE(
      logged(LogLevel::debug, "parentSessionForChild: Checking userInfoKey 'phone:call' for session 3"));
  EXPECT_EQ(backendOf(child).combinedSessionIDString(), "A1.B");
}

TEST_F(AgentHierarchy, ChildWithoutAListIsAnError) {
  Client child = start("B", 3, 1);
  child.session->setSessionInfo(info(3, 8), user("Nobody"), std::nullopt, false);
  EXPECT_EQ(agent->parentSessionForChild(*child.session), nullptr);
  EXPECT_TRUE(logged(LogLevel::error,
                     "parentSessionForChild: ERROR: No sessions found for user info key nobody:call"));
  EXPECT_FALSE(agent->parentSessionIDStringForSession(*child.session));
  EXPECT_TRUE(logged(LogLevel::error,
                     "parentSessionIDStringForSession: ERROR: No sessions found for user info key "
                     "nobody:call"));
}

TEST_F(AgentHierarchy, AnEmptyListIsAsGoodAsNone) {
  start("A", 1, 0, false, "Nobody").disconnect();
  Client child = start("B", 3, 1);
  child.session->setSessionInfo(info(3, 8), user("Nobody"), std::nullopt, false);
  EXPECT_EQ(agent->parentSessionForChild(*child.session), nullptr);
  EXPECT_TRUE(logged(LogLevel::error,
                     "parentSessionForChild: ERROR: No sessions found for user info key nobody:call"));
}

TEST_F(AgentHierarchy, ChildThatIsNotInItsListIsAnError) {
  const Client other = start("A", 1, 0, false, "Other");
  Client child = start("B", 3, 1);
  child.session->setSessionInfo(info(3, 8), user("Other"), std::nullopt, false);
  EXPECT_EQ(agent->parentSessionForChild(*child.session), nullptr);
  EXPECT_TRUE(logged(LogLevel::error,
                     "parentSessionForChild: ERROR: Session 3 not found for user info key other:call"));
  EXPECT_FALSE(agent->parentSessionIDStringForSession(*child.session));
  EXPECT_TRUE(
      logged(LogLevel::error,
             "parentSessionIDStringForSession: ERROR: Session 3 not found for user info key other:call"));
}

TEST_F(AgentHierarchy, ParentIdsReadFromTheTopDown) {
  start("A", 1, 0);
  start("B", 2, 1);
  const Client c = start("C", 3, 2);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*c.session), "A.B");
  EXPECT_TRUE(logged(LogLevel::debug,
                     "parentSessionIDStringForSession: Checking userInfoKey 'phone:call' for session 3"));
  EXPECT_EQ(backendOf(c).combinedSessionIDString(), "A.B.C");
}

TEST_F(AgentHierarchy, GapRightAboveGivesNoParentId) {
  start("A", 1, 0);
  const Client c = start("C", 3, 2);
  EXPECT_FALSE(agent->parentSessionIDStringForSession(*c.session));
  EXPECT_TRUE(logged(LogLevel::information,
                     "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): "
                     "incomplete parentSessionID is '(null)'"));
  EXPECT_EQ(agent->parentSessionForChild(*c.session), nullptr);
  EXPECT_TRUE(logged(
      LogLevel::information,
      "parentSessionForChild: Unable to find session with hierarchy of 1 for userInfoKey 'phone:call'"));
  EXPECT_EQ(backendOf(c).combinedSessionIDString(), "C");
}

TEST_F(AgentHierarchy, GapFurtherUpGivesWhatWasBuiltSoFar) {
  start("B", 2, 1);
  const Client c = start("C", 3, 2);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*c.session), "B");
  EXPECT_TRUE(logged(LogLevel::information,
                     "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): "
                     "incomplete parentSessionID is 'B'"));
}

TEST_F(AgentHierarchy, LevelsOfAnyNumberEndTheWalksSoon) {
  const Client lowest = start("L", 1, INT32_MIN);
  const Client highest = start("H", 2, INT32_MAX);
  EXPECT_EQ(agent->parentSessionForChild(*lowest.session), nullptr);
  EXPECT_FALSE(agent->parentSessionIDStringForSession(*lowest.session));
  EXPECT_FALSE(agent->parentSessionIDStringForSession(*highest.session));
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*highest.session), nullptr);
}

// A session that configures changes its level on its own thread, also in the middle of another's walk.

TEST_F(AgentHierarchy, ASessionThatRisesDuringAWalkIsNotItsOwnParent) {
  const Client top = start("A", 1, 0);
  const Client riser = start("B", 2, 2);
  whenLogged("parentSessionForChild: Checking userInfoKey 'phone:call' for session 2",
             [this, &riser] { standAt(riser, 1); });
  EXPECT_EQ(agent->parentSessionForChild(*riser.session), nullptr);
  EXPECT_EQ(riser.session->getSessionHierarchy(), 1);
  EXPECT_EQ(agent->parentSessionForChild(*riser.session), top.session);
}

TEST_F(AgentHierarchy, ASessionThatRisesDuringAWalkIsNotItsOwnAncestor) {
  const Client top = start("A", 1, 0);
  const Client riser = start("B", 2, 2);
  whenLogged("parentSessionIDStringForSession: Checking userInfoKey 'phone:call' for session 2",
             [this, &riser] { standAt(riser, 1); });
  EXPECT_FALSE(agent->parentSessionIDStringForSession(*riser.session));
  EXPECT_EQ(agent->parentSessionIDStringForSession(*riser.session), "A");
}

// Aggregation.

TEST_F(AgentHierarchy, AncestorIsTheTopMostWithAnAggregator) {
  const Client a = start("A", 1, 0);
  const Client b = start("B", 2, 1, true);
  const Client c = start("C", 3, 2);
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*c.session), b.session);
  a.session->setHasAggregator(true);
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*c.session), a.session);
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*a.session), nullptr);
}

TEST_F(AgentHierarchy, OnlyTheFirstOfALevelCountsAndGapsDoNotMatter) {
  const Client first = start("A1", 1, 0);
  const Client second = start("A2", 2, 0, true);
  const Client deep = start("D", 4, 5);
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*deep.session), nullptr);
  const Client middle = start("M", 5, 3, true);
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*deep.session), middle.session);
}

TEST_F(AgentHierarchy, AncestorsStandAtLevelZeroAndBelow) {
  const Client odd = start("O", 1, -1, true);
  const Client child = start("B", 2, 1);
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*child.session), nullptr);
}

TEST_F(AgentHierarchy, AncestorOfASessionWithoutUserInfoIsNone) {
  const Client a = connect();
  a.session->setSessionInfo(info(5, 8), std::nullopt, std::nullopt, false);
  world.log.clear();
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*a.session), nullptr);
  EXPECT_THAT(
      world.log.lines(),
      ElementsAre(FakeLog::Line{LogLevel::information,
                                "getAncestorWithAggregatorForSession: No user info found for session 5"}));
}

TEST_F(AgentHierarchy, MessageOfAChildReachesTheAncestorsClient) {
  const Client parent = start("A", 1, 0, true);
  const Client child = start("B", 2, 1);
  const size_t before = parent.connection->sentToClient().size();
  bool isLocked = false;
  parent.connection->whenProxyIsAsked = [this, &isLocked] { isLocked = !isFree(agent->agentLock()); };
  child.session->sendMessageWithCategory(3, 4, Dictionary{{"a", 1}});
  parent.connection->whenProxyIsAsked = nullptr;
  EXPECT_TRUE(isLocked);
  const auto received = parent.connection->sentToClient();
  ASSERT_EQ(received.size(), before + 1);
  EXPECT_EQ(received.back().messageInfo, info(2, 8));
  EXPECT_EQ(
      received.back().payload,
      (Dictionary{{"a", 1}, {kTarnelUserInfoClientName, "Phone"}, {kTarnelUserInfoServiceName, "Call"}}));
  EXPECT_THAT(child.connection->sentToClient(), IsEmpty());
}

TEST_F(AgentHierarchy, AMessageOfAChildWithoutPayloadReachesTheAncestorsClientWithNone) {
  const Client parent = start("A", 1, 0, true);
  const Client child = start("B", 2, 1);
  const size_t before = parent.connection->sentToClient().size();
  child.session->sendMessageWithCategory(3, 4, std::nullopt);
  const auto received = parent.connection->sentToClient();
  ASSERT_EQ(received.size(), before + 1);
  EXPECT_EQ(received.back().messageInfo, info(2, 8));
  EXPECT_EQ(received.back().category, 3);
  EXPECT_EQ(received.back().payload, std::nullopt);
}

// Downstream.

TEST_F(AgentHierarchy, DownstreamWithoutUserInfoDoesNothing) {
  const Client a = connect();
  a.session->setSessionInfo(info(5, 8), std::nullopt, std::nullopt, false);
  agent->updateDownstreamSessions(*a.session);
  EXPECT_TRUE(logged(LogLevel::information, "updateDownstreamSessions: No user info found for session 5"));
}

TEST_F(AgentHierarchy, LateParentLabelsAndSyncsTheDeeperSessions) {
  backends.scripts[kTarnelBackendHTTPPost].threshold = Value(0.75);
  const Client child = start("B", 2, 1);
  const Client grandchild = start("C", 3, 2);
  EXPECT_EQ(backendOf(child).state(), ReportingState::enabled);
  backends.scripts[kTarnelBackendHTTPPost].decides = ReportingState::disabled;
  backends.scripts[kTarnelBackendHTTPPost].threshold = Value(0.25);
  const Client parent = start("A", 1, 0);
  for (const int number : {2, 3}) {
    EXPECT_TRUE(logged(LogLevel::debug,
                       "updateDownstreamSessions: Updating combined session ID and syncing reporting states "
                       "for session " +
                           std::to_string(number)));
  }
  // States hold at once, all the way down.
  EXPECT_EQ(backendOf(child).state(), ReportingState::disabled);
  EXPECT_EQ(backendOf(grandchild).state(), ReportingState::disabled);
  EXPECT_EQ(grandchild.session->reports().at(0).samplingThreshold, Value(0.25));
  // The backends themselves follow with their session's next step.
  child.session->sendMessageWithCategory(1, 2, std::nullopt);
  grandchild.session->sendMessageWithCategory(1, 2, std::nullopt);
  EXPECT_EQ(backendOf(child).combinedSessionIDString(), "A.B");
  EXPECT_EQ(backendOf(grandchild).combinedSessionIDString(), "A.B.C");
  EXPECT_EQ(backendOf(child).samplingThreshold(), Value(0.25));
  EXPECT_EQ(backendOf(grandchild).samplingThreshold(), Value(0.25));
}

TEST_F(AgentHierarchy, AChildThatStartsUnderItsParentTakesItsState) {
  backends.scripts[kTarnelBackendHTTPPost].decides = ReportingState::disabled;
  backends.scripts[kTarnelBackendHTTPPost].threshold = Value(0.25);
  start("A", 1, 0);
  backends.scripts[kTarnelBackendHTTPPost].decides = ReportingState::enabled;
  backends.scripts[kTarnelBackendHTTPPost].threshold = Value(0.75);
  const Client child = start("B", 2, 1);
  EXPECT_EQ(backendOf(child).state(), ReportingState::disabled);
  EXPECT_EQ(backendOf(child).samplingThreshold(), Value(0.25));
}

TEST_F(AgentHierarchy, SessionsOfTheSameLevelAndAboveAreLeftAlone) {
  const Client parent = start("A", 1, 0);
  const Client sibling = start("B1", 2, 1);
  world.log.clear();
  start("B2", 3, 1);
  EXPECT_THAT(world.log.startingWith("updateDownstreamSessions"), IsEmpty());
}

TEST_F(AgentHierarchy, AggregatingParentEndsTheAggregationBelow) {
  const Client child = start("B", 2, 1, true);
  const Client grandchild = start("C", 3, 2, false);
  EXPECT_TRUE(child.session->hasAggregator());
  world.log.clear();
  start("A", 1, 0, true);
  EXPECT_FALSE(child.session->hasAggregator());
  EXPECT_FALSE(child.connection->sentToClient().back().messageInfo);
  EXPECT_TRUE(
      logged(LogLevel::debug, "shutdownSessionAggregation: Disable aggregation module for session 2"));
  // Who has none is not told.
  EXPECT_FALSE(
      logged(LogLevel::debug, "shutdownSessionAggregation: Disable aggregation module for session 3"));
}

TEST_F(AgentHierarchy, AChildUnderAnAggregatorEndsItsOwnAndThatOfThoseBelow) {
  const Client parent = start("A", 1, 0, true);
  const Client grandchild = start("C", 3, 2, false);
  grandchild.session->setHasAggregator(true);
  const Client child = start("B", 2, 1, true);
  EXPECT_FALSE(child.session->hasAggregator());
  EXPECT_FALSE(grandchild.session->hasAggregator());
  EXPECT_TRUE(parent.session->hasAggregator());
}

TEST_F(AgentHierarchy, WithoutAnyAggregatorAboveTheDeeperOnesKeepTheirs) {
  const Client child = start("B", 2, 1, true);
  start("A", 1, 0, false);
  EXPECT_TRUE(child.session->hasAggregator());
}

TEST_F(AgentHierarchy, DestroyedSessionIsNotBroughtBack) {
  const Client parent = start("A", 1, 0, true);
  Client child = start("B", 2, 1);
  const size_t before = parent.connection->sentToClient().size();
  child.disconnect();
  EXPECT_THAT(listed(), ElementsAre(parent.session));
  // Its stop message still reaches the ancestor.
  ASSERT_EQ(parent.connection->sentToClient().size(), before + 1);
  EXPECT_EQ(parent.connection->sentToClient().back().type, 1);
}

}  // namespace
}  // namespace tarnel::fake
