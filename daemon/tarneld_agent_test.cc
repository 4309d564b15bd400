#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <new>
#include <thread>

#include "daemon/test_agent_fixture.h"

namespace tarnel::fake {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class AgentAcceptance : public AgentTest {};

TEST_F(AgentAcceptance, AgentBeginsWithThreeEmptyCollections) {
  EXPECT_THAT(agent->sessionList(), IsEmpty());
  EXPECT_THAT(agent->cachedStorebags(), IsEmpty());
  EXPECT_THAT(agent->correlatedSessions(), IsEmpty());
}

TEST_F(AgentAcceptance, ConnectionWithoutTheEntitlementIsRefusedBeforeAnythingIsMade) {
  const auto connection = std::make_shared<FakeIpcConnection>("<stranger>");
  connection->entitlements["com.orvane.private.other"] = true;
  EXPECT_FALSE(agent->shouldAcceptNewConnection(listener, connection));
  EXPECT_THAT(world.log.lines(),
              ElementsAre(FakeLog::Line{LogLevel::debug,
                                        "listener: new LNK connection <stranger> does not have required "
                                        "tarnel entitlement. Closing connection..."}));
  EXPECT_EQ(connection->exportedObject, nullptr);
  EXPECT_EQ(connection->invalidationHandler, nullptr);
  EXPECT_FALSE(connection->isResumed);
  EXPECT_THAT(agent->sessionList(), IsEmpty());
  EXPECT_EQ(world.keepAlive.begun, 0);
  connect("<client>");
  EXPECT_TRUE(logged(LogLevel::debug,
                     "listener: Accepting new LNK connection <client> as it has proper entitlement, 0(0) "
                     "connections."));
}

TEST_F(AgentAcceptance, AFalseEntitlementIsNone) {
  const auto connection = std::make_shared<FakeIpcConnection>();
  connection->entitlements["com.orvane.private.tarneld"] = false;
  EXPECT_FALSE(agent->shouldAcceptNewConnection(listener, connection));
}

TEST_F(AgentAcceptance, ConnectionIsBoundAndListedBeforeItIsResumed) {
  const auto connection = entitledConnection();
  connection->whenResumed = [this, watched = connection.get()] {
    ASSERT_NE(watched->exportedObject, nullptr);
    EXPECT_TRUE(watched->hasRemoteObjectInterface);
    EXPECT_TRUE(watched->interruptionHandler);
    EXPECT_TRUE(watched->invalidationHandler);
    EXPECT_EQ(world.keepAlive.begun, 1);
    EXPECT_THAT(agent->sessionList(),
                ElementsAre(std::static_pointer_cast<TarneldSession>(watched->exportedObject)));
  };
  EXPECT_TRUE(agent->shouldAcceptNewConnection(listener, connection));
  EXPECT_TRUE(connection->isResumed);
  EXPECT_TRUE(logged(LogLevel::debug,
                     "initWithSessionDelegate: TarneldSession initWithSessionDelegate:<TarneldAgent>"));
  connection->invalidate();
}

TEST_F(AgentAcceptance, CountsAreTakenBeforeTheNewSessionIsAdded) {
  start("A", 1, 0);
  start("B", 2, 0, false, "Other");
  connect("<third>");
  EXPECT_TRUE(logged(LogLevel::debug,
                     "listener: Accepting new LNK connection <third> as it has proper entitlement, 2(2) "
                     "connections."));
}

TEST_F(AgentAcceptance, TransactionOpensWithTheFirstAndClosesWithTheLast) {
  Client first = connect();
  EXPECT_EQ(world.keepAlive.begun, 1);
  Client second = connect();
  EXPECT_EQ(world.keepAlive.begun, 1);
  first.disconnect();
  EXPECT_EQ(world.keepAlive.ended, 0);
  second.disconnect();
  EXPECT_EQ(world.keepAlive.ended, 1);
  connect();
  EXPECT_EQ(world.keepAlive.begun, 2);
}

TEST_F(AgentAcceptance, InterruptedConnectionKeepsItsSession) {
  const Client client = connect();
  client.connection->interrupt();
  EXPECT_TRUE(logged(LogLevel::debug,
                     "listener: LNK connection to " + client.session->description() + " was interrupted"));
  EXPECT_THAT(agent->sessionList(), ElementsAre(client.session));
  EXPECT_EQ(world.keepAlive.ended, 0);
}

TEST_F(AgentAcceptance, InvalidatedConnectionTakesItsSessionOutOfBothCollections) {
  Client client = start("A", 1, 0);
  const std::string line =
      "listener: LNK connection to " + client.session->description() + " was invalidated";
  EXPECT_EQ(agent->correlatedSessions().at("phone:call").size(), 1U);
  const std::weak_ptr<TarneldSession> gone = client.session;
  client.disconnect();
  EXPECT_TRUE(gone.expired());
  EXPECT_TRUE(logged(LogLevel::debug, line));
  EXPECT_THAT(agent->sessionList(), IsEmpty());
  ASSERT_TRUE(agent->correlatedSessions().contains("phone:call"));  // an empty list stays
  EXPECT_THAT(agent->correlatedSessions().at("phone:call"), IsEmpty());
  EXPECT_TRUE(logged(LogLevel::debug, "dealloc: TarneldSession dealloc: 1"));
}

TEST_F(AgentAcceptance, SessionWithoutUserInfoIsInvalidatedHarmlessly) {
  connect().disconnect();
  EXPECT_THAT(agent->sessionList(), IsEmpty());
  EXPECT_THAT(agent->correlatedSessions(), IsEmpty());
}

TEST_F(AgentAcceptance, SessionThatChangedItsNamesUnfiledIsNotLeftBehind) {
  Client client = start("A", 1, 0);
  client.session->setSessionInfo(info(1, 8), user("Other"), std::nullopt, false);
  const std::weak_ptr<TarneldSession> gone = client.session;
  client.disconnect();
  EXPECT_TRUE(gone.expired());
  EXPECT_THAT(agent->correlatedSessions().at("phone:call"), IsEmpty());
}

TEST_F(AgentAcceptance, HandlersKeepTheAgentUntilTheConnectionIsInvalidated) {
  Client client = connect();
  const std::weak_ptr<TarneldAgent> watched = agent;
  agent.reset();
  EXPECT_FALSE(watched.expired());
  client.disconnect();
  EXPECT_TRUE(watched.expired());
}

TEST_F(AgentAcceptance, AcceptanceDoesNotWaitForTheAgentsLock) {
  const LockGuard guard(agent->agentLock());
  std::thread([this] { connect("<meanwhile>"); }).join();
  EXPECT_EQ(agent->sessionList().size(), 1U);
}

TEST_F(AgentAcceptance, AConnectionThatCannotBeServedLeavesNoSessionAndWaitsForNoLock) {
  const auto connection = entitledConnection();
  connection->canBeServed = false;
  const LockGuard guard(agent->agentLock());
  std::thread([this, &connection] {
    EXPECT_FALSE(agent->shouldAcceptNewConnection(listener, connection));
    const std::weak_ptr<ClientSessionInterface> session = connection->exportedObject;
    // What a listener does with a connection that is not accepted.
    connection->invalidationHandler = nullptr;
    connection->exportedObject.reset();
    EXPECT_TRUE(session.expired());
  }).join();
  EXPECT_THAT(agent->sessionList(), IsEmpty());
  EXPECT_EQ(world.keepAlive.begun, 1);
  EXPECT_EQ(world.keepAlive.ended, 1);
  EXPECT_THAT(world.log.startingWith("listener: LNK connection"), IsEmpty());  // it is not invalidated
}

TEST_F(AgentAcceptance, AnAcceptanceThatThrowsLeavesNoSession) {
  const auto connection = entitledConnection();
  connection->whenResumed = [] { throw std::bad_alloc(); };
  EXPECT_THROW(agent->shouldAcceptNewConnection(listener, connection), std::bad_alloc);
  EXPECT_THAT(agent->sessionList(), IsEmpty());
  EXPECT_EQ(world.keepAlive.ended, 1);
  connection->invalidationHandler = nullptr;
  connection->exportedObject.reset();
}

TEST_F(AgentAcceptance, InvalidationTakesTheTwoLocksOneAfterTheOther) {
  Client client = start("A", 1, 0);
  const auto connection = client.connection;
  client = {};
  std::thread invalidation;
  {
    const LockGuard guard(agent->agentLock());
    invalidation = std::thread([&connection] { connection->invalidate(); });
    // The session leaves the list while the agent's lock is ours; that the list can be read meanwhile, to
    // the end of the wait, says that its lock is not kept for the other.
    while (!agent->sessionList().empty()) std::this_thread::yield();
    while (world.keepAlive.ended == 0) std::this_thread::yield();
    EXPECT_EQ(agent->correlatedSessions().at("phone:call").size(), 1U);
  }
  invalidation.join();
  EXPECT_THAT(agent->correlatedSessions().at("phone:call"), IsEmpty());
}

TEST_F(AgentAcceptance, TransactionFollowsTheListUnderItsLock) {
  // Many come and go at once: the transaction is begun and ended in turns, never twice in a row.
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([this] {
      for (int round = 0; round < 200; ++round) {
        const auto connection = entitledConnection();
        agent->shouldAcceptNewConnection(listener, connection);
        connection->invalidate();
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_FALSE(world.keepAlive.turnedTwice);
  EXPECT_GE(world.keepAlive.begun, 1);
  EXPECT_EQ(world.keepAlive.begun, world.keepAlive.ended);
}

TEST_F(AgentAcceptance, NamesThatClientsInventAreBoundedOnceNobodyIsUnderThem) {
  Client client = start("A", 1, 0);
  start("B", 2, 0, false, "Steady");
  const std::string filler(100000, 'x');
  for (int i = 0; i < 100; ++i) {
    client.session->receivedUserInfo(user(filler + std::to_string(i)));
  }
  const auto lists = agent->correlatedSessions();
  EXPECT_LE(lists.size(), TarneldAgent::kCorrelationKeyBytes / filler.size() + 1);
  EXPECT_EQ(lists.at("steady:call").size(), 1U);
  EXPECT_EQ(lists.at(filler + "99:call").size(), 1U);
}

}  // namespace
}  // namespace tarnel::fake
